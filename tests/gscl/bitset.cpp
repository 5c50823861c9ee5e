// The growing set of bits.
#include <gtest/gtest.h>
#include <limits.h>

#include "gscl/GSBitSet.h"

namespace {

using zelt_gscl_V1::GSBitSet;

TEST(BitSet, construction_fillsWholeWords) {
  const GSBitSet none(0, 1);
  EXPECT_EQ(none.size(), 0);
  EXPECT_EQ(none.get(5), 0);
  EXPECT_EQ(none.AreAllZero(), 1);
  const GSBitSet ones(33, 1);
  EXPECT_EQ(ones.size(), 64);
  for (int i = 0; i < 64; ++i) EXPECT_EQ(ones.get(i), 1) << i;
  EXPECT_EQ(ones.get(64), 0);
  EXPECT_EQ(GSBitSet(32, 0).size(), 32);
  EXPECT_EQ(GSBitSet(32, 0).AreAllZero(), 1);
}

TEST(BitSet, set_growsJustFarEnoughForEitherValue) {
  GSBitSet set;
  set.set(100, 1);
  EXPECT_EQ(set.size(), 128);
  for (int i = 0; i < 128; ++i) EXPECT_EQ(set[i], i == 100 ? 1 : 0) << i;
  set.set(128, 0);
  EXPECT_EQ(set.size(), 160);
  EXPECT_EQ(set.get(100), 1);
  set.set(100, 0);
  EXPECT_EQ(set.AreAllZero(), 1);
  set.set(-1, 1);
  set.set(INT_MIN, 1);
  EXPECT_EQ(set.get(-1), 0);
  EXPECT_EQ(set.AreAllZero(), 1);
  EXPECT_EQ(set.size(), 160);
}

TEST(BitSet, comparison_ignoresWordsThatAreMissing) {
  GSBitSet empty, longer(64, 0);
  EXPECT_EQ(empty.AreTheySame(longer), 1);
  EXPECT_EQ(longer.AreTheySame(empty), 1);
  longer.set(40, 1);
  EXPECT_EQ(empty.AreTheySame(longer), 0);
  EXPECT_EQ(longer.AreTheySame(empty), 0);
  GSBitSet other(41, 0);
  other.set(40, 1);
  EXPECT_EQ(other.AreTheySame(longer), 1);
  other.set(3, 1);
  EXPECT_EQ(other.AreTheySame(longer), 0);
}

TEST(BitSet, copies_haveTheirOwnWordsAndTheExactCapacity) {
  GSBitSet source(96, 0), target(500, 1);
  source.set(77, 1);
  target.CopyFrom(source);
  EXPECT_EQ(target.size(), 96);
  EXPECT_EQ(target.AreTheySame(source), 1);
  GSBitSet copy(source), assigned;
  assigned = source;
  assigned = *&assigned;
  target.CopyFrom(target);
  source.set(77, 0);
  for (const GSBitSet* set : {&target, &copy, &assigned}) {
    EXPECT_EQ(set->get(77), 1);
    EXPECT_EQ(set->size(), 96);
  }
  target.CopyFrom(GSBitSet());
  EXPECT_EQ(target.size(), 0);
}

TEST(BitSet, fillEraseAndBounds_followTheBits) {
  GSBitSet set(64, 0);
  EXPECT_EQ(set.lowerbound(), -1);
  EXPECT_EQ(set.upperbound(), -1);
  set.set(31, 1);
  set.set(32, 1);
  EXPECT_EQ(set.lowerbound(), 31);
  EXPECT_EQ(set.upperbound(), 32);
  set.fillall(-1);
  EXPECT_EQ(set.lowerbound(), 0);
  EXPECT_EQ(set.upperbound(), 63);
  EXPECT_EQ(set.size(), 64);
  set.fillall(0);
  EXPECT_EQ(set.AreAllZero(), 1);
  set.eraseall();
  EXPECT_EQ(set.size(), 0);
  set.fillall(1);
  EXPECT_EQ(set.AreAllZero(), 1);
}

}  // namespace
