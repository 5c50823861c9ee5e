// Membership lists, state values, attributes, strings, buffers and bit sets: what they keep, copy and own, and
// what a failed allocation leaves.
#include <limits.h>

#include <cstring>
#include <string>
#include <vector>

#include "gscl/GSBitSet.h"
#include "gscl/GSDebug.h"
#include "gscl/GSLocalVar.h"
#include "gscl/GSString.h"
#include "gscl/GSValues.h"
#include "tests/support/allocations.h"

namespace {

using namespace zelt_gscl_V1;  // NOLINT: the classes under test

// Capacities are part of what is promised, and read from the object's form, which is too.
static_assert(sizeof(GSMembershipList) == 24 && sizeof(GSStateValue) == 32 && sizeof(GSGroupAttributes) == 88);

int capacity(const GSMembershipList& list) { return reinterpret_cast<const int*>(&list)[2]; }
int capacity(const GSStateValue& value) { return reinterpret_cast<const int*>(&value)[4]; }

wyx_provider_t id(int instance, int node = 1) {
  return wyx_provider_t{{static_cast<short>(instance), static_cast<short>(node)}};
}

/// A membership record over ids that it holds itself.
struct Record {
  explicit Record(std::vector<int> instances) {
    for (int instance : instances) ids.push_back(id(instance));
    record = {static_cast<unsigned int>(ids.size()), ids.data()};
  }
  operator const wyx_membership_t*() const { return &record; }

  std::vector<wyx_provider_t> ids;
  wyx_membership_t record;
};

using Ids = std::vector<int>;

Ids instances(const GSMembershipList& list) {
  Ids found;
  for (int i = 0; i < list.count(); i++) found.push_back(list.at(i)._gs_provider_info._gs_instance_number);
  return found;
}

std::vector<std::string> traced;

TEST(MembershipList, ids_addedAndTakenOutKeepTheirOrder) {
  GSMembershipList list;
  Ids expected;
  for (int i = 1; i <= 17; i++) {
    EXPECT_EQ(list.append(id(i)), 1);
    expected.push_back(i);
    EXPECT_EQ(capacity(list), i <= 8 ? 8 : i <= 16 ? 16 : 24) << i;
  }
  EXPECT_EQ(instances(list), expected);
  list = Record({1, 2, 3});
  EXPECT_EQ(capacity(list), 24);
  EXPECT_EQ(list.remove(3), 0);
  EXPECT_EQ(list.remove(-1), 0);
  EXPECT_EQ(list.remove(0), 1);
  EXPECT_EQ(instances(list), (Ids{2, 3}));
  EXPECT_EQ(list.at(2).gs_provider_id, -1);
  EXPECT_EQ(list.minus(Record({3, 7, 3})), 1);
  EXPECT_EQ(list.find(id(2, 2)), -1) << "the node number counts too";

  GSSetDebugLevel(GSCL_TRC_DETAIL);
  const gscl_tracef_rtn before = GSSetTraceRtn([](int, char* text) { traced.push_back(text); });
  EXPECT_EQ(list.plus(Record({1, 2, 1})), 1);
  GSSetDebugLevel(0);
  GSSetTraceRtn(before);
  EXPECT_EQ(instances(list), (Ids{2, 1}));
  EXPECT_EQ(traced, std::vector<std::string>(2, "GSMbrship::plus() is already included\n"));

  const wyx_membership_t* none = nullptr;
  EXPECT_EQ(list.plus(none) + list.minus(none), 0);
  list = none;
  EXPECT_EQ(list.count(), 0);
}

TEST(MembershipList, copied_takesIdsAsTheyComeAndSharesNothing) {
  GSMembershipList a(Record({1, 2, 3, 4, 5, 6, 7, 1}));
  EXPECT_EQ(capacity(a), 16);
  GSMembershipList b(a);
  b.append(id(3));
  a = *&a;
  EXPECT_EQ(instances(a), (Ids{1, 2, 3, 4, 5, 6, 7, 1}));
  a = b;
  EXPECT_EQ(instances(a), (Ids{1, 2, 3, 4, 5, 6, 7, 1, 3}));
  a = GSMembershipList();
  EXPECT_EQ(a.count(), 0);
}

wyx_state_value_t value_of(std::string& bytes) { return {static_cast<int>(bytes.size()), bytes.data()}; }

std::string bytes(const GSStateValue& value) {
  const wyx_state_value_t* record = value.getValue();
  return record == nullptr ? "" : std::string(record->gs_state, static_cast<size_t>(record->gs_length));
}

TEST(StateValue, copied_keepsItsRoomAndSharesNothing) {
  std::string ten = "0123456789", four = "abcd";
  wyx_state_value_t ten_record = value_of(ten), four_record = value_of(four);
  GSStateValue value(&ten_record);
  const char* area = value.getValue()->gs_state;
  EXPECT_EQ(bytes(value), ten);
  EXPECT_NE(area, ten.data());
  value = &four_record;
  EXPECT_EQ(bytes(value), four);
  EXPECT_EQ(capacity(value), 10);
  EXPECT_EQ(value.getValue()->gs_state, area);
  GSStateValue copy(value);
  EXPECT_EQ(capacity(copy), 4);
  value = value.getValue();
  value = *&value;
  EXPECT_EQ(bytes(value), four);
  for (wyx_state_value_t nothing : {wyx_state_value_t{0, ten.data()}, {-1, ten.data()}, {5, nullptr}}) {
    EXPECT_EQ(GSStateValue(&nothing).getValue(), nullptr);
    value = &nothing;
    EXPECT_EQ(bytes(copy), four);
    EXPECT_EQ(value.getValue(), nullptr);
  }
  copy = static_cast<wyx_state_value_t*>(nullptr);
  EXPECT_EQ(copy.getValue(), nullptr);
}

/// Every field set to something that is not its default.
wyx_group_attributes_t unusual_attributes(std::string& name, std::string& source) {
  wyx_group_attributes_t record = {};
  record.gs_version = 5;
  record.gs_sizeof_group_attributes = 40;
  record.gs_client_version = 7;
  record.gs_batch_control = WYX_BATCH_BOTH;
  record.gs_num_phases = record.gs_source_reflection_num_phases = WYX_N_PHASE;
  record.gs_group_default_vote = record.gs_merge_default_vote = WYX_VOTE_REJECT;
  record.gs_merge_control = WYX_LARGER_MERGE;
  record.gs_time_limit = 11;
  record.gs_source_reflection_time_limit = 13;
  record.gs_group_name = name.data();
  record.gs_source_group_name = source.data();
  return record;
}

/// A copy: names of its own with the same texts, three fields that are not copied, all else as it was.
void expect_copied(const GSGroupAttributes& attributes, wyx_group_attributes_t from) {
  const wyx_group_attributes_t copy = *attributes.getAttributes();
  for (auto name : {&wyx_group_attributes_t::gs_group_name, &wyx_group_attributes_t::gs_source_group_name}) {
    EXPECT_NE(copy.*name, from.*name);
    EXPECT_STREQ(copy.*name, from.*name);
    from.*name = copy.*name;
  }
  from.gs_version = 0;
  from.gs_sizeof_group_attributes = 56;
  from.gs_merge_default_vote = WYX_NULL_VOTE;
  EXPECT_EQ(std::memcmp(&copy, &from, sizeof(copy)), 0);
}

TEST(GroupAttributes, setFromTheOwnNames_takesThemAsTheyWere) {
  GSGroupAttributes attributes;
  wyx_group_attributes_t* record = attributes.getAttributes();
  attributes.setGroupName("group");
  attributes.setSourceGroupName("another source");
  std::swap(record->gs_group_name, record->gs_source_group_name);
  attributes.setAttributes(record);
  EXPECT_STREQ(record->gs_group_name, "another source");
  EXPECT_STREQ(record->gs_source_group_name, "group");
  record->gs_source_group_name = record->gs_group_name + 8;
  attributes.setAttributes(record);
  EXPECT_STREQ(record->gs_source_group_name, "source");
}

TEST(GroupAttributes, copied_ownTheirNamesAndKeepThreeFields) {
  std::string name = "group", source = "source";
  const wyx_group_attributes_t record = unusual_attributes(name, source);
  const GSGroupAttributes first(&record);
  GSGroupAttributes third;
  {
    GSGroupAttributes second(first);
    third = second;
    expect_copied(second, record);
  }
  expect_copied(first, record);
  third.setAttributes(third.getAttributes());
  third.setAttributes(nullptr);
  expect_copied(third, record);

  wyx_group_attributes_t expected = {};
  const GSGroupAttributes zero(static_cast<const wyx_group_attributes_t*>(nullptr)), defaults;
  EXPECT_EQ(std::memcmp(zero.getAttributes(), &expected, sizeof(expected)), 0);
  expected.gs_sizeof_group_attributes = 56;
  expected.gs_num_phases = expected.gs_source_reflection_num_phases = WYX_1_PHASE;
  expected.gs_group_default_vote = WYX_VOTE_APPROVE;
  EXPECT_EQ(std::memcmp(defaults.getAttributes(), &expected, sizeof(expected)), 0);
}

const char* text(const GSString& s) { return s; }

TEST(String, compared_byTextAndNullOnlyWithNull) {
  const char* null = nullptr;
  const GSString none, alsoNone(null), empty(""), s("text");
  char same[] = "text";
  EXPECT_TRUE(none == null && none == alsoNone && none != empty && none != "");
  EXPECT_TRUE(empty == "" && empty != null);
  EXPECT_TRUE(s == same && s == GSString(same) && s != same + 1 && s != "tex" && s != null);
  EXPECT_EQ(std::string(GSString(100), 100), std::string(100, '\0'));
}

TEST(String, assigned_growsToFitAndNeverShrinks) {
  GSString s(33);
  const auto expect = [&](const std::string& expected, int size) {
    EXPECT_STREQ(s, expected.c_str());
    EXPECT_EQ(s.length(), static_cast<int>(expected.size()));
    EXPECT_EQ(s.size(), size);
  };
  s = "hello";
  expect("hello", 33);
  s.set_string(std::string(40, 'n').c_str(), 32);
  expect(std::string(32, 'n'), 41);  // room is made for the whole text
  s.set_string("abcdef", 1);
  expect("a", 41);
  s.set_string("abcdef", 60);
  expect("abcdef", 41);
  s = nullptr;
  EXPECT_EQ(text(s), nullptr);
  EXPECT_EQ(s.size(), 0);
  s += "xy";
  expect("xy", 3);
  s += static_cast<const char*>(nullptr);
  s += "12345678901234567890";
  expect("xy12345678901234567890", 23);
}

TEST(String, ownTextAsArgument_isCopiedIntact) {
  GSString s("abcdef");
  s = *&s;
  s.set_string(static_cast<char*>(s) + 2, 0);
  EXPECT_STREQ(s, "cdef");
  s.set_string(static_cast<char*>(s) + 1, 2);
  EXPECT_STREQ(s, "de");
  s += static_cast<char*>(s);  // in place
  EXPECT_STREQ(s, "dede");
  EXPECT_EQ(s.size(), 7);
  s += static_cast<char*>(s) + 1;  // into new storage
  EXPECT_STREQ(s, "dedeede");
  const GSString sum = s + static_cast<char*>(s);
  EXPECT_STREQ(sum, "dedeedededeede");
  EXPECT_EQ(sum.size(), 15);
  GSString room(50), copy;
  room = "text";
  EXPECT_EQ(GSString(room).size(), 5);
  copy = room;
  room = "else";
  EXPECT_STREQ(copy, "text");
}

TEST(BitSet, bits_inWholeWordsThatGrowJustFarEnough) {
  GSBitSet set(33, 1);
  EXPECT_EQ(set.size(), 64);
  EXPECT_EQ(set.upperbound(), 63);
  set.fillall(0);
  set.set(100, 1);
  EXPECT_EQ(set.size(), 128);
  for (int i = 0; i < 130; ++i) EXPECT_EQ(set[i], i == 100 ? 1 : 0) << i;
  set.set(99, 1);
  set.set(128, 0);
  EXPECT_EQ(set.size(), 160) << "for either value";
  EXPECT_EQ(set.lowerbound(), 99);
  EXPECT_EQ(set.upperbound(), 100);
  set.set(100, 0);
  set.set(99, 0);
  for (int outside : {-1, INT_MIN}) {
    set.set(outside, 1);
    EXPECT_EQ(set.get(outside), 0);
  }
  EXPECT_EQ(set.AreAllZero(), 1);
  set.eraseall();
  EXPECT_EQ(set.lowerbound() + set.upperbound() + set.size(), -2);
}

TEST(BitSet, copiesAndComparison) {
  GSBitSet source(96, 0), target(500, 1), assigned;
  EXPECT_EQ(assigned.AreTheySame(source), 1) << "missing words are zeros";
  source.set(77, 1);
  EXPECT_EQ(assigned.AreTheySame(source), 0);
  EXPECT_EQ(source.AreTheySame(assigned), 0);
  target.CopyFrom(source);
  target.CopyFrom(target);
  GSBitSet copy(source);
  assigned = source;
  EXPECT_EQ(assigned.AreTheySame(source), 1);
  source.set(77, 0);
  EXPECT_EQ(assigned.AreTheySame(source), 0);
  for (const GSBitSet* set : {&target, &copy, &assigned}) {
    EXPECT_EQ(set->lowerbound(), 77);
    EXPECT_EQ(set->size(), 96);
  }
}

TEST(Values, allocationFails_objectsStayConsistent) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be counted or refused in this build";
  std::string longer(100, 'n'), four = "abcd";
  const wyx_state_value_t state = value_of(longer), small = value_of(four);
  const wyx_group_attributes_t attributes = unusual_attributes(longer, longer);
  GSStateValue value(&small);
  GSMembershipList list(Record({1, 2, 3, 4, 5, 6, 7})), fresh;
  list.append(id(8));  // fills its room
  const Record many({1, 2, 3, 4, 5, 6, 7, 8, 9});
  GSGroupAttributes named;
  named.setGroupName("old");
  GSString replaced("short"), appended("short");
  GSLocalVar<char> buffer(8);
  {
    const allocations::Refuse refuse;
    EXPECT_THROW(value = &state, std::bad_alloc);
    EXPECT_THROW(list.append(id(9)), std::bad_alloc);
    EXPECT_THROW(list = many, std::bad_alloc);
    EXPECT_THROW(named.setAttributes(&attributes), std::bad_alloc);
    EXPECT_THROW(replaced = longer.c_str(), std::bad_alloc);
    EXPECT_THROW(appended += longer.c_str(), std::bad_alloc);
    EXPECT_THROW(buffer.allocate(100), std::bad_alloc);
  }
  for (int after = 0; after < 2; after++) {
    const allocations::Refuse refuse(after);
    EXPECT_THROW(fresh = many, std::bad_alloc);
    EXPECT_THROW(GSMembershipList{many}, std::bad_alloc);  // leaves nothing behind
    EXPECT_THROW(GSGroupAttributes{&attributes}, std::bad_alloc);
  }
  EXPECT_EQ(bytes(value), four);
  EXPECT_EQ(instances(list), (Ids{1, 2, 3, 4, 5, 6, 7, 8}));
  EXPECT_EQ(fresh.count(), 0);
  EXPECT_EQ(named.getAttributes()->gs_group_name, nullptr);
  EXPECT_EQ(text(replaced), nullptr);
  EXPECT_EQ(replaced.size(), 0);
  EXPECT_STREQ(appended, "short");
  EXPECT_TRUE(!buffer && buffer.size() == 0);
  fresh = many;
  EXPECT_EQ(fresh.count(), 9);
}

}  // namespace
