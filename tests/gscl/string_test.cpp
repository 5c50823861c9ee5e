#include <gtest/gtest.h>

#include <string>

#include "gscl/GSLocalVar.h"
#include "gscl/GSString.h"
#include "tests/support/allocations.h"

namespace {

using zelt_gscl_V1::GSLocalVar;
using zelt_gscl_V1::GSString;

const char* text(const GSString& s) { return s; }

TEST(String, withoutStorage_equalsOnlyNull) {
  const GSString empty;
  EXPECT_EQ(empty.size(), 0);
  EXPECT_EQ(empty.length(), 0);
  EXPECT_EQ(text(empty), nullptr);
  const char* null = nullptr;
  EXPECT_TRUE(empty == null);
  EXPECT_FALSE(empty == "");
  EXPECT_FALSE(GSString("") == null);
  EXPECT_TRUE(GSString("") == "");
  EXPECT_TRUE(empty == GSString(null));
  EXPECT_TRUE(empty != GSString(""));
  EXPECT_TRUE(empty == nullptr);
  EXPECT_EQ(GSString(0).size(), 0);
  EXPECT_EQ(text(GSString(-3)), nullptr);
}

TEST(String, compared_byTextNotByAddress) {
  GSString s("text");
  char same[] = "text";
  char* other = same + 1;
  EXPECT_TRUE(s == same);
  EXPECT_FALSE(s != same);
  EXPECT_TRUE(s != other);
  EXPECT_FALSE(s != "text");
  EXPECT_TRUE(s == GSString(same));
  EXPECT_FALSE(s == "tex");
}

TEST(String, createdWithSize_isZeroFilled) {
  GSString s(100);
  EXPECT_EQ(s.size(), 100);
  EXPECT_EQ(s.length(), 0);
  EXPECT_EQ(std::string(s, 100), std::string(100, '\0'));
}

TEST(String, assigned_growsToFitAndNeverShrinks) {
  GSString s(100);
  s = "hello";
  EXPECT_EQ(s.size(), 100);
  EXPECT_TRUE(s == "hello");
  s = std::string(200, 'x').c_str();
  EXPECT_EQ(s.size(), 201);
  EXPECT_EQ(s.length(), 200);
  s = "";
  EXPECT_EQ(s.size(), 201);
  s = nullptr;
  EXPECT_EQ(s.size(), 0);
  EXPECT_EQ(text(s), nullptr);
}

TEST(String, setWithLength_keepsThatManyCharacters) {
  GSString s(33);
  s.set_string(std::string(40, 'n').c_str(), 32);
  EXPECT_EQ(s.length(), 32);
  EXPECT_EQ(s.size(), 41);  // room is made for the whole text
  s.set_string("abcdef", 3);
  EXPECT_TRUE(s == "abc");
  s.set_string("abcdef", 60);
  EXPECT_TRUE(s == "abcdef");
  s.set_string("abcdef", -1);
  EXPECT_TRUE(s == "abcdef");
}

TEST(String, appended_inPlaceWhileItFits) {
  GSString s(10);
  s = "abc";
  const char* area = s;
  s += "defg";
  EXPECT_TRUE(s == "abcdefg");
  EXPECT_EQ(text(s), area);
  s = "abc";
  s += "12345678901234567890";
  EXPECT_EQ(s.size(), 24);
  EXPECT_TRUE(s == "abc12345678901234567890");
  s += static_cast<const char*>(nullptr);
  EXPECT_EQ(s.size(), 24);

  GSString empty;
  empty += GSString();
  EXPECT_EQ(empty.size(), 0);
  empty += "xy";
  EXPECT_EQ(empty.size(), 3);
  empty += GSString("z");
  EXPECT_TRUE(empty == "xyz");
}

TEST(String, ownTextAsArgument_isCopiedIntact) {
  GSString s("abcdef");
  const GSString& same = s;
  s = same;
  EXPECT_TRUE(s == "abcdef");
  s.set_string(static_cast<char*>(s) + 2, 0);
  EXPECT_TRUE(s == "cdef");
  EXPECT_EQ(s.size(), 7);
  s.set_string(static_cast<char*>(s) + 1, 2);
  EXPECT_TRUE(s == "de");
  s += static_cast<char*>(s);  // in place
  EXPECT_TRUE(s == "dede");
  s += static_cast<char*>(s) + 1;  // into new storage
  EXPECT_TRUE(s == "dedeede");
  s += s;
  EXPECT_TRUE(s == "dedeedededeede");
}

TEST(String, copied_sharesNothing) {
  GSString a(50);
  a = "text";
  GSString b(a);
  EXPECT_EQ(b.size(), 5);  // the text's size, not the original's
  EXPECT_NE(text(a), text(b));
  GSString c;
  c = b;
  b = "else";
  EXPECT_TRUE(c == "text");
  c = GSString();
  EXPECT_EQ(text(c), nullptr);
}

TEST(String, concatenated_hasExactlyTheRoomItNeeds) {
  GSString a(50);
  a = "left";
  const GSString sum = a + "right";
  EXPECT_TRUE(sum == "leftright");
  EXPECT_EQ(sum.size(), 10);
  EXPECT_TRUE(GSString() + "right" == "right");
  EXPECT_EQ((a + nullptr).size(), 5);
  EXPECT_TRUE(a + static_cast<char*>(a) == "leftleft");
}

TEST(String, allocationFails_stringIsEmptyOrUnchanged) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be counted or refused in this build";
  GSString replaced("short");
  GSString appended("short");
  const std::string longer(100, 'x');
  {
    const allocations::Refuse refuse;
    EXPECT_THROW(replaced = longer.c_str(), std::bad_alloc);
    EXPECT_THROW(appended += longer.c_str(), std::bad_alloc);
  }
  EXPECT_EQ(text(replaced), nullptr);
  EXPECT_EQ(replaced.size(), 0);
  EXPECT_TRUE(appended == "short");
  replaced = "again";
  EXPECT_TRUE(replaced == "again");
}

TEST(LocalVar, allocatedAnew_replacesItsBuffer) {
  GSLocalVar<char> buffer(0);
  EXPECT_TRUE(!buffer);
  EXPECT_EQ(buffer.data(), nullptr);
  EXPECT_EQ(buffer.size(), 0u);
  buffer.allocate(8);
  EXPECT_FALSE(!buffer);
  EXPECT_EQ(buffer.size(), 8u);
  EXPECT_EQ(static_cast<char*>(buffer), buffer.data());
  buffer.erase();
  EXPECT_EQ(std::string(buffer, 8), std::string(8, '\0'));
  buffer[7] = 'z';
  EXPECT_EQ(buffer.data()[7], 'z');
}

TEST(LocalVar, allocationFails_leavesNoBuffer) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be counted or refused in this build";
  GSLocalVar<char> buffer(8);
  {
    const allocations::Refuse refuse;
    EXPECT_THROW(buffer.allocate(100), std::bad_alloc);
  }
  EXPECT_EQ(buffer.data(), nullptr);
  EXPECT_EQ(buffer.size(), 0u);
}

}  // namespace
