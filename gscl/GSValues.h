// Owned copies of base API records: membership, state value, group attributes.
//
// A notification's records are gone when its callback returns; these classes keep what they said, in records of
// the same form that can be handed to the base API. Every object owns every byte that it points at; copies share
// nothing. Threads: no locking; whoever owns an object guards it (a client with its own lock). Errors: only a
// failed allocation, thrown; the object keeps a consistent value then. Sizes that fit what is already there
// allocate nothing.
#ifndef GSCL_GSVALUES_H
#define GSCL_GSVALUES_H

#include "gscl/GSString.h"
#include "gscl/export.h"
#include "gscl/wyx_api.h"

namespace zelt_gscl_V1 {

/// A list of provider ids, in the order in which they were added. It grows in steps of eight ids and never
/// shrinks.
class ZN_GSCL_EXPORT GSMembershipList {
 public:
  GSMembershipList();
  /// A copy of the record's ids; an empty list for null.
  GSMembershipList(const wyx_membership_t* mbrs);
  GSMembershipList(const GSMembershipList& other);
  virtual ~GSMembershipList();

  /// Replaces the ids by copies of the record's; none for null.
  GSMembershipList& operator=(const wyx_membership_t* mbrs);
  GSMembershipList& operator=(const GSMembershipList& other);

  /// The number of ids.
  int count() const;
  /// The id at index i; an id of all ones (-1) when there is none.
  wyx_provider_t at(int i) const;
  /// Takes all ids out; room for them is kept.
  void eraseall();
  /// Adds an id at the end, also when it is present already. Returns 1.
  int append(const wyx_provider_t& id);
  /// Takes out the id at index i; later ones move down by one. Returns 1, or 0 when there is no such index.
  int remove(int i);
  /// The index of the first id equal to this, -1 when there is none.
  int find(const wyx_provider_t& id) const;
  /// Adds the id unless present. Returns 1 when added, else 0.
  int plus(const wyx_provider_t& id);
  /// Takes out the first id equal to this. Returns 1, or 0 when absent.
  int minus(const wyx_provider_t& id);
  /// plus or minus for each id of the record in order; nothing for null. Returns how many were added or taken out.
  int plus(const wyx_membership_t* mbrs);
  int minus(const wyx_membership_t* mbrs);

 private:
  void _prepare(int nitems, int keep_data);
  void copy(const wyx_membership_t* mbrs);
  void copy(const GSMembershipList& other);

  int n_alloc;                // ids that the array has room for
  wyx_membership_t* mbrship;  // null until the list is first filled
};

/// A group state value: bytes and their number. A value of no bytes counts as empty. Its room never shrinks.
class ZN_GSCL_EXPORT GSStateValue {
 public:
  GSStateValue();
  /// A copy of the record's bytes; empty for null, for a length below 1 and for a record without bytes.
  GSStateValue(const wyx_state_value_t* value);
  GSStateValue(const GSStateValue& other);
  ~GSStateValue();

  GSStateValue& operator=(const wyx_state_value_t* value);
  GSStateValue& operator=(const GSStateValue& other);

  /// The value as a record of the base API, null when empty. The record is this object's and good until the next
  /// change.
  wyx_state_value_t* getValue();
  const wyx_state_value_t* getValue() const;

 private:
  void copy(const wyx_state_value_t* value);

  wyx_state_value_t state_value;
  int state_size;  // bytes that state_area has room for
  char* state_area;
};

/// The attributes of a group. The record handed out points at this object's own copies of the two names.
class ZN_GSCL_EXPORT GSGroupAttributes {
 public:
  /// One phase, default vote approve, no batching, no time limits, merges dissolve, no names.
  GSGroupAttributes();
  /// A copy of the record's fields and names, except gs_version, gs_sizeof_group_attributes and
  /// gs_merge_default_vote, which are 0, 56 and 0; all zero for null.
  GSGroupAttributes(const wyx_group_attributes_t* attributes);
  GSGroupAttributes(const GSGroupAttributes& other);
  ~GSGroupAttributes();

  GSGroupAttributes& operator=(const GSGroupAttributes& other);

  /// The record; this object's, good until the next change.
  wyx_group_attributes_t* getAttributes();
  const wyx_group_attributes_t* getAttributes() const;
  /// Takes over the record's fields and names as the constructor does; gs_version and gs_merge_default_vote keep
  /// their values. Nothing for null.
  void setAttributes(const wyx_group_attributes_t* attributes);
  /// Sets a name; null takes it away.
  void setGroupName(const char* name);
  void setSourceGroupName(const char* name);

 private:
  void copy(const wyx_group_attributes_t* attributes);

  wyx_group_attributes_t _gattr;
  GSString _group_name;
  GSString _source_group_name;
};

}  // namespace zelt_gscl_V1

#endif
