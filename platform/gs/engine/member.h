// A provider as its group sees it, and the table of all clients.
#pragma once

#include <map>
#include <memory>
#include <string>

#include "engine/types.h"

namespace gs {

/// A voter's part in the running protocol.
struct Ballot {
  bool open = false;                              // asked in this phase, has not voted
  wyx_vote_value_t vote = WYX_NULL_VOTE;          // in this phase
  wyx_vote_value_t default_vote = WYX_NULL_VOTE;  // given with an earlier vote; WYX_NULL_VOTE: the group's
  std::uint32_t summary = 0;                      // flags of wyx_summary_code_t, of the vote
  std::optional<Bytes> proposed_state;            // kept only where vote results are collected
  std::optional<Bytes> message;
};

struct Member {
  enum class Stage : std::uint8_t {
    kQueued,   // its join waits
    kJoining,  // its join runs
    kJoined,   // in the membership
    kOut,
  };
  Endpoint to;
  ProviderId id;
  std::string local_name;
  Stage stage = Stage::kQueued;
  bool leaving = false;  // its leave waits or runs
  std::uint32_t gone_code =
      0;  // flags of wyx_leave_code_t once it has died or said goodbye: it hears nothing more
  Ballot ballot;

  bool gone() const { return gone_code != 0; }
};

/// Shared by its group's lists and the client table.
using MemberPtr = std::shared_ptr<Member>;

struct Client {
  std::string group;
  MemberPtr provider;  // null: a subscriber
};

/// Everybody who may make a request with a token, and be sent something.
using ClientTable = std::map<Endpoint, Client>;

}  // namespace gs
