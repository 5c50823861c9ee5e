#include "gscl/GSValues.h"

#include <climits>
#include <cstring>
#include <functional>
#include <new>

#include "gscl/GSUtils.h"
#include "gscl/trace.h"

namespace zelt_gscl_V1 {
namespace {

/// Ids that a record holds; list indices are int.
int ids_in(const wyx_membership_t* mbrs) {
  if (mbrs == nullptr || mbrs->gs_providers == nullptr) return 0;
  if (mbrs->gs_count > static_cast<unsigned int>(INT_MAX - 8)) throw std::bad_alloc();
  return static_cast<int>(mbrs->gs_count);
}

int bytes_in(const wyx_state_value_t* value) {
  if (value == nullptr || value->gs_state == nullptr || value->gs_length < 0) return 0;
  return value->gs_length;
}

/// Whether the text begins in the string's storage.
bool isInside(const GSString& string, const char* text) {
  const char* storage = string;
  const std::less<const char*> before;
  return storage != nullptr && !before(text, storage) && before(text, storage + string.size());
}

}  // namespace

// The constructors from a value delegate, so that an allocation that fails half-way leaves nothing behind.

GSMembershipList::GSMembershipList() : n_alloc(0), mbrship(nullptr) {}

GSMembershipList::GSMembershipList(const wyx_membership_t* mbrs) : GSMembershipList() { copy(mbrs); }

GSMembershipList::GSMembershipList(const GSMembershipList& other) : GSMembershipList() { copy(other); }

GSMembershipList::~GSMembershipList() {
  gscl_delete_membership(mbrship);
  delete mbrship;
  mbrship = nullptr;
}

GSMembershipList& GSMembershipList::operator=(const wyx_membership_t* mbrs) {
  copy(mbrs);
  return *this;
}

GSMembershipList& GSMembershipList::operator=(const GSMembershipList& other) {
  copy(other);
  return *this;
}

int GSMembershipList::count() const { return mbrship == nullptr ? 0 : static_cast<int>(mbrship->gs_count); }

wyx_provider_t GSMembershipList::at(int i) const {
  wyx_provider_t none;
  none.gs_provider_id = -1;
  return i >= 0 && i < count() ? mbrship->gs_providers[i] : none;
}

void GSMembershipList::eraseall() {
  if (mbrship != nullptr) mbrship->gs_count = 0;
}

int GSMembershipList::append(const wyx_provider_t& id) {
  _prepare(count() + 1, 1);
  mbrship->gs_providers[mbrship->gs_count++] = id;
  return 1;
}

int GSMembershipList::remove(int i) {
  if (i < 0 || i >= count()) return 0;
  wyx_provider_t* ids = mbrship->gs_providers;
  std::memmove(ids + i, ids + i + 1, sizeof(*ids) * static_cast<size_t>(count() - i - 1));
  mbrship->gs_count--;
  return 1;
}

int GSMembershipList::find(const wyx_provider_t& id) const { return gscl_find_membership(mbrship, id); }

int GSMembershipList::plus(const wyx_provider_t& id) { return find(id) == -1 ? append(id) : 0; }

int GSMembershipList::minus(const wyx_provider_t& id) { return remove(find(id)); }

int GSMembershipList::plus(const wyx_membership_t* mbrs) {
  int added = 0;
  const int n = ids_in(mbrs);
  for (int i = 0; i < n; i++) {
    if (plus(mbrs->gs_providers[i]) == 1)
      added++;
    else
      GS_TRACE(GSCL_TRC_DETAIL, "GSMbrship::plus() is already included\n");
  }
  return added;
}

int GSMembershipList::minus(const wyx_membership_t* mbrs) {
  int removed = 0;
  const int n = ids_in(mbrs);
  for (int i = 0; i < n; i++) removed += minus(mbrs->gs_providers[i]);
  return removed;
}

void GSMembershipList::_prepare(int nitems, int keep_data) {
  if (mbrship == nullptr) mbrship = new wyx_membership_t{0, nullptr};
  if (n_alloc >= nitems) return;
  const int room = (nitems / 8 + 1) * 8;
  wyx_provider_t* ids = new wyx_provider_t[static_cast<size_t>(room)];
  const unsigned int kept = keep_data != 0 ? mbrship->gs_count : 0;
  if (kept > 0) std::memcpy(ids, mbrship->gs_providers, sizeof(*ids) * kept);
  delete[] mbrship->gs_providers;
  mbrship->gs_providers = ids;
  n_alloc = room;
}

void GSMembershipList::copy(const wyx_membership_t* mbrs) {
  const int n = ids_in(mbrs);
  _prepare(n, 0);
  if (n > 0)
    std::memmove(mbrship->gs_providers, mbrs->gs_providers, sizeof(wyx_provider_t) * static_cast<size_t>(n));
  mbrship->gs_count = static_cast<unsigned int>(n);
}

void GSMembershipList::copy(const GSMembershipList& other) { copy(other.mbrship); }

GSStateValue::GSStateValue() : state_value(), state_size(0), state_area(nullptr) {}

GSStateValue::GSStateValue(const wyx_state_value_t* value) : GSStateValue() { copy(value); }

GSStateValue::GSStateValue(const GSStateValue& other) : GSStateValue() { copy(other.getValue()); }

GSStateValue::~GSStateValue() { delete[] state_area; }

GSStateValue& GSStateValue::operator=(const wyx_state_value_t* value) {
  copy(value);
  return *this;
}

GSStateValue& GSStateValue::operator=(const GSStateValue& other) {
  copy(other.getValue());
  return *this;
}

wyx_state_value_t* GSStateValue::getValue() { return state_value.gs_length != 0 ? &state_value : nullptr; }

const wyx_state_value_t* GSStateValue::getValue() const {
  return state_value.gs_length != 0 ? &state_value : nullptr;
}

void GSStateValue::copy(const wyx_state_value_t* value) {
  const int n = bytes_in(value);
  char* room = state_size < n ? new char[static_cast<size_t>(n)] : state_area;
  if (n > 0) std::memmove(room, value->gs_state, static_cast<size_t>(n));
  if (room != state_area) {
    delete[] state_area;
    state_area = room;
    state_size = n;
  }
  state_value.gs_length = n;
  state_value.gs_state = state_area;
}

GSGroupAttributes::GSGroupAttributes() : _gattr(), _group_name(), _source_group_name() {
  _gattr.gs_sizeof_group_attributes = sizeof(wyx_group_attributes_t);
  _gattr.gs_batch_control = WYX_NO_BATCHING;
  _gattr.gs_num_phases = WYX_1_PHASE;
  _gattr.gs_source_reflection_num_phases = WYX_1_PHASE;
  _gattr.gs_group_default_vote = WYX_VOTE_APPROVE;
  _gattr.gs_merge_control = WYX_DISSOLVE_MERGE;
}

GSGroupAttributes::GSGroupAttributes(const wyx_group_attributes_t* attributes)
    : _gattr(), _group_name(), _source_group_name() {
  copy(attributes);
}

GSGroupAttributes::GSGroupAttributes(const GSGroupAttributes& other) : GSGroupAttributes(other.getAttributes()) {}

GSGroupAttributes::~GSGroupAttributes() = default;

GSGroupAttributes& GSGroupAttributes::operator=(const GSGroupAttributes& other) {
  copy(other.getAttributes());
  return *this;
}

wyx_group_attributes_t* GSGroupAttributes::getAttributes() { return &_gattr; }

const wyx_group_attributes_t* GSGroupAttributes::getAttributes() const { return &_gattr; }

void GSGroupAttributes::setAttributes(const wyx_group_attributes_t* attributes) { copy(attributes); }

// A name that cannot be stored leaves its string empty, so the record must not point at it meanwhile.

void GSGroupAttributes::setGroupName(const char* name) {
  _gattr.gs_group_name = nullptr;
  _group_name = name;
  _gattr.gs_group_name = _group_name;
}

void GSGroupAttributes::setSourceGroupName(const char* name) {
  _gattr.gs_source_group_name = nullptr;
  _source_group_name = name;
  _gattr.gs_source_group_name = _source_group_name;
}

void GSGroupAttributes::copy(const wyx_group_attributes_t* attributes) {
  if (attributes == nullptr) return;
  const wyx_group_attributes_t from = *attributes;  // may be this object's own record, which changes below
  // The source group's name may stand where the group's name is about to be stored.
  const bool is_in_the_way = isInside(_group_name, from.gs_source_group_name);
  const GSString source(is_in_the_way ? from.gs_source_group_name : nullptr);
  setGroupName(from.gs_group_name);
  setSourceGroupName(is_in_the_way ? static_cast<const char*>(source) : from.gs_source_group_name);
  _gattr.gs_sizeof_group_attributes = sizeof(wyx_group_attributes_t);
  _gattr.gs_client_version = from.gs_client_version;
  _gattr.gs_batch_control = from.gs_batch_control;
  _gattr.gs_num_phases = from.gs_num_phases;
  _gattr.gs_merge_control = from.gs_merge_control;
  _gattr.gs_time_limit = from.gs_time_limit;
  _gattr.gs_group_default_vote = from.gs_group_default_vote;
  _gattr.gs_source_reflection_num_phases = from.gs_source_reflection_num_phases;
  _gattr.gs_source_reflection_time_limit = from.gs_source_reflection_time_limit;
}

}  // namespace zelt_gscl_V1
