#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "gscl/GSDebug.h"
#include "gscl/GSValues.h"
#include "tests/support/allocations.h"

namespace {

using zelt_gscl_V1::GSGroupAttributes;
using zelt_gscl_V1::GSMembershipList;
using zelt_gscl_V1::GSStateValue;

// Capacities are part of what is promised, and read from the object's form, which is too.
static_assert(sizeof(GSMembershipList) == 24 && sizeof(GSStateValue) == 32 && sizeof(GSGroupAttributes) == 88);

int capacity(const GSMembershipList& list) {
  int n = 0;
  std::memcpy(&n, reinterpret_cast<const char*>(&list) + 8, sizeof(n));
  return n;
}

int capacity(const GSStateValue& value) {
  int n = 0;
  std::memcpy(&n, reinterpret_cast<const char*>(&value) + 16, sizeof(n));
  return n;
}

wyx_provider_t id(int instance, int node = 1) {
  wyx_provider_t provider;
  provider._gs_provider_info._gs_instance_number = static_cast<short>(instance);
  provider._gs_provider_info._gs_node_number = static_cast<short>(node);
  return provider;
}

/// A membership record over ids that it holds itself.
struct Record {
  explicit Record(std::vector<int> instances) {
    for (int instance : instances) ids.push_back(id(instance));
    record.gs_count = static_cast<unsigned int>(ids.size());
    record.gs_providers = ids.data();
  }
  operator const wyx_membership_t*() const { return &record; }

  std::vector<wyx_provider_t> ids;
  wyx_membership_t record;
};

std::vector<int> instances(const GSMembershipList& list) {
  std::vector<int> found;
  for (int i = 0; i < list.count(); i++) found.push_back(list.at(i)._gs_provider_info._gs_instance_number);
  return found;
}

using Ids = std::vector<int>;

TEST(MembershipList, empty_answersNothingAndKeepsQuiet) {
  GSMembershipList list;
  EXPECT_EQ(list.count(), 0);
  list.eraseall();
  EXPECT_EQ(list.minus(id(1)), 0);
  EXPECT_EQ(list.find(id(1)), -1);
  EXPECT_EQ(list.remove(0), 0);
  EXPECT_EQ(list.at(0).gs_provider_id, -1);
  EXPECT_EQ(capacity(list), 0);
  const wyx_membership_t* none = nullptr;
  EXPECT_EQ(list.plus(none), 0);
  EXPECT_EQ(list.minus(none), 0);
  list = none;
  EXPECT_EQ(list.count(), 0);
}

TEST(MembershipList, grown_stepsOfEightKeepOrder) {
  GSMembershipList list;
  Ids expected;
  for (int i = 1; i <= 17; i++) {
    EXPECT_EQ(list.append(id(i)), 1);
    expected.push_back(i);
    EXPECT_EQ(capacity(list), i <= 8 ? 8 : i <= 16 ? 16 : 24) << i;
  }
  EXPECT_EQ(instances(list), expected);
  list.eraseall();
  EXPECT_EQ(list.count(), 0);
  EXPECT_EQ(capacity(list), 24);
}

TEST(MembershipList, copiedFromRecord_takesIdsAsTheyCome) {
  GSMembershipList list(Record({1, 2, 3, 4, 5, 6, 7, 1}));
  EXPECT_EQ(capacity(list), 16);
  EXPECT_EQ(instances(list), (Ids{1, 2, 3, 4, 5, 6, 7, 1}));
  list = Record({9});
  EXPECT_EQ(capacity(list), 16);
  EXPECT_EQ(instances(list), Ids{9});
  list = static_cast<const wyx_membership_t*>(nullptr);
  EXPECT_EQ(list.count(), 0);
  EXPECT_EQ(GSMembershipList(Record({})).count(), 0);
}

TEST(MembershipList, copied_sharesNothing) {
  GSMembershipList a(Record({1, 2}));
  GSMembershipList b(a);
  b.append(id(3));
  const GSMembershipList& same = a;
  a = same;
  EXPECT_EQ(instances(a), (Ids{1, 2}));
  EXPECT_EQ(instances(b), (Ids{1, 2, 3}));
  a = b;
  EXPECT_EQ(instances(a), (Ids{1, 2, 3}));
  a = GSMembershipList();
  EXPECT_EQ(a.count(), 0);
}

TEST(MembershipList, idsTakenOut_laterOnesMoveDown) {
  GSMembershipList list(Record({1, 2, 3}));
  EXPECT_EQ(list.remove(3), 0);
  EXPECT_EQ(list.remove(-1), 0);
  EXPECT_EQ(list.remove(0), 1);
  EXPECT_EQ(instances(list), (Ids{2, 3}));
  EXPECT_EQ(list.at(2).gs_provider_id, -1);
  EXPECT_EQ(list.minus(Record({3, 7, 3})), 1);
  EXPECT_EQ(instances(list), Ids{2});
  EXPECT_EQ(list.find(id(2, 2)), -1) << "the node number counts too";
}

std::vector<std::string> traced;

TEST(MembershipList, presentIdsAdded_tracedAndLeftAlone) {
  traced.clear();
  GSSetDebugLevel(GSCL_TRC_DETAIL);
  const gscl_tracef_rtn before = GSSetTraceRtn([](int, char* text) { traced.push_back(text); });
  GSMembershipList list(Record({2}));
  EXPECT_EQ(list.plus(Record({1, 2, 1})), 1);
  GSSetDebugLevel(0);
  EXPECT_EQ(list.plus(Record({1})), 0);
  GSSetTraceRtn(before);
  EXPECT_EQ(instances(list), (Ids{2, 1}));
  EXPECT_EQ(traced, std::vector<std::string>(2, "GSMbrship::plus() is already included\n"));
}

wyx_state_value_t value_of(std::string& bytes) { return {static_cast<int>(bytes.size()), bytes.data()}; }

std::string bytes(const GSStateValue& value) {
  const wyx_state_value_t* record = value.getValue();
  return record == nullptr ? "" : std::string(record->gs_state, static_cast<size_t>(record->gs_length));
}

TEST(StateValue, copied_keepsItsRoomAndSharesNothing) {
  std::string ten = "0123456789";
  std::string four = "abcd";
  const wyx_state_value_t ten_record = value_of(ten);
  const wyx_state_value_t four_record = value_of(four);
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
  const GSStateValue& same = value;
  value = same;
  EXPECT_EQ(bytes(value), four);
  value = static_cast<const wyx_state_value_t*>(nullptr);
  EXPECT_EQ(bytes(copy), four);
  copy = value;
  EXPECT_EQ(copy.getValue(), nullptr);
}

TEST(StateValue, withoutBytes_isEmpty) {
  std::string some = "x";
  wyx_state_value_t record = {0, some.data()};
  EXPECT_EQ(GSStateValue(&record).getValue(), nullptr);
  record.gs_length = -1;
  EXPECT_EQ(GSStateValue(&record).getValue(), nullptr);
  record = {5, nullptr};
  EXPECT_EQ(GSStateValue(&record).getValue(), nullptr);
  EXPECT_EQ(GSStateValue(static_cast<wyx_state_value_t*>(nullptr)).getValue(), nullptr);
  EXPECT_EQ(GSStateValue().getValue(), nullptr);
}

/// Every field set to something that is not its default.
wyx_group_attributes_t unusual_attributes(std::string& name, std::string& source) {
  wyx_group_attributes_t record = {};
  record.gs_version = 5;
  record.gs_sizeof_group_attributes = 40;
  record.gs_client_version = 7;
  record.gs_batch_control = WYX_BATCH_BOTH;
  record.gs_num_phases = WYX_N_PHASE;
  record.gs_source_reflection_num_phases = WYX_N_PHASE;
  record.gs_group_default_vote = WYX_VOTE_REJECT;
  record.gs_merge_control = WYX_LARGER_MERGE;
  record.gs_time_limit = 11;
  record.gs_source_reflection_time_limit = 13;
  record.gs_group_name = name.data();
  record.gs_source_group_name = source.data();
  record.gs_merge_default_vote = WYX_VOTE_REJECT;
  return record;
}

/// A copy: names of its own with the same texts, three fields that are not copied, all else as it was.
void expect_copied(wyx_group_attributes_t copy, wyx_group_attributes_t from) {
  EXPECT_NE(copy.gs_group_name, from.gs_group_name);
  EXPECT_STREQ(copy.gs_group_name, from.gs_group_name);
  EXPECT_NE(copy.gs_source_group_name, from.gs_source_group_name);
  EXPECT_STREQ(copy.gs_source_group_name, from.gs_source_group_name);
  from.gs_group_name = copy.gs_group_name;
  from.gs_source_group_name = copy.gs_source_group_name;
  from.gs_version = 0;
  from.gs_sizeof_group_attributes = 56;
  from.gs_merge_default_vote = WYX_NULL_VOTE;
  EXPECT_EQ(std::memcmp(&copy, &from, sizeof(copy)), 0);
}

TEST(GroupAttributes, madeFromNothing_areDefaultsOrZero) {
  const GSGroupAttributes defaults;
  const wyx_group_attributes_t& record = *defaults.getAttributes();
  wyx_group_attributes_t expected = {};
  expected.gs_sizeof_group_attributes = 56;
  expected.gs_num_phases = WYX_1_PHASE;
  expected.gs_source_reflection_num_phases = WYX_1_PHASE;
  expected.gs_group_default_vote = WYX_VOTE_APPROVE;
  EXPECT_EQ(std::memcmp(&record, &expected, sizeof(record)), 0);

  const GSGroupAttributes zero(static_cast<const wyx_group_attributes_t*>(nullptr));
  expected = {};
  EXPECT_EQ(std::memcmp(zero.getAttributes(), &expected, sizeof(expected)), 0);
}

TEST(GroupAttributes, copied_ownTheirNamesAndKeepThreeFields) {
  std::string name = "group";
  std::string source = "source";
  const wyx_group_attributes_t record = unusual_attributes(name, source);
  const GSGroupAttributes first(&record);
  GSGroupAttributes third;
  {
    GSGroupAttributes second(first);
    third.setGroupName("a name that was there before");
    third = second;
    expect_copied(*second.getAttributes(), record);
  }
  expect_copied(*first.getAttributes(), record);
  expect_copied(*third.getAttributes(), record);
  third.setAttributes(third.getAttributes());
  third.setAttributes(nullptr);
  expect_copied(*third.getAttributes(), record);
  third.setGroupName(nullptr);
  third.setSourceGroupName("s");
  EXPECT_EQ(third.getAttributes()->gs_group_name, nullptr);
  EXPECT_STREQ(third.getAttributes()->gs_source_group_name, "s");
}

TEST(Values, updatedWithSizesThatFit_allocateNothing) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be counted or refused in this build";
  std::string sixty_four(64, 's');
  const wyx_state_value_t state = value_of(sixty_four);
  const Record members({1, 2, 3, 4, 5, 6, 7, 8});
  std::string name = "group";
  std::string source = "source";
  const wyx_group_attributes_t attributes = unusual_attributes(name, source);
  GSStateValue value(&state);
  GSMembershipList list(members);
  GSGroupAttributes copy(&attributes);
  const long before = allocations::count();
  value = &state;
  list = members;
  list.minus(members);
  list.plus(members);
  copy.setAttributes(&attributes);
  EXPECT_EQ(allocations::count(), before);
}

TEST(Values, allocationFails_objectsStayConsistent) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be counted or refused in this build";
  std::string longer(100, 'n');
  const wyx_state_value_t state = value_of(longer);
  std::string four = "abcd";
  const wyx_state_value_t small = value_of(four);
  const wyx_group_attributes_t attributes = unusual_attributes(longer, longer);
  GSStateValue value(&small);
  GSMembershipList list(Record({1, 2, 3, 4, 5, 6, 7}));
  list.append(id(8));  // fills its room
  GSMembershipList fresh;
  const Record many({1, 2, 3, 4, 5, 6, 7, 8, 9});
  GSGroupAttributes named;
  named.setGroupName("old");
  {
    const allocations::Refuse refuse;
    EXPECT_THROW(value = &state, std::bad_alloc);
    EXPECT_THROW(list.append(id(9)), std::bad_alloc);
    EXPECT_THROW(list = many, std::bad_alloc);
    EXPECT_THROW(named.setAttributes(&attributes), std::bad_alloc);
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
  fresh = many;
  EXPECT_EQ(fresh.count(), 9);
}

}  // namespace
