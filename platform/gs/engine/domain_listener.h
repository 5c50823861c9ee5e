// What one session is told of the domain, as the flags of its set-up ask for it, and what it answers.
#pragma once

#include "engine/types.h"

namespace gs {

/// The flags of wyx_socket_ctrl_t that ask for something here.
inline constexpr std::uint32_t kDomainControlBits =
    WYX_ENABLE_DOMAIN_EVENT | WYX_ENABLE_OPQUORUM_CALLBACK | WYX_ENABLE_OPQUORUM_ACK_REQUIRED;

class DomainListener {
 public:
  DomainListener() = default;
  explicit DomainListener(std::uint32_t socket_control)
      : nodes_((socket_control & WYX_ENABLE_DOMAIN_EVENT) != 0),
        quorum_((socket_control & WYX_ENABLE_OPQUORUM_CALLBACK) != 0),
        answers_(quorum_ && (socket_control & WYX_ENABLE_OPQUORUM_ACK_REQUIRED) != 0) {}

  bool hears(const DomainNotification& notification) const {
    const bool of_nodes = std::holds_alternative<NodesNotification>(notification) ||
                          std::holds_alternative<MasterNotification>(notification);
    return of_nodes ? nodes_ : quorum_;
  }

  /// For a session that begins: everything as it is now.
  std::vector<DomainNotification> greeting(const DomainView& now) {
    std::vector<DomainNotification> all;
    if (nodes_ && !now.nodes.empty()) {
      all.emplace_back(NodesNotification{now.nodes, now.nodes, {}});
      all.emplace_back(MasterNotification{now.nodes.front(), static_cast<std::uint32_t>(now.nodes.size())});
    }
    if (!quorum_) return all;
    if (answers_) awaited_ = ++last_;
    all.emplace_back(QuorumNotification{awaited_, WYX_QUORUM_STATE_PENDING, WYX_QUORUM_STATE_HAS, now.seqnum});
    return all;
  }

  /// WYX_OK, or why this answer to a quorum notification is refused. Nobody waits for it.
  wyx_rc_t answered(std::uint64_t sequence) {
    if (!answers_) return WYX_NOT_REGISTERED_FOR_SYNC_QUORUM;
    if (awaited_ == 0) return WYX_UNEXPECTED_QUORUM_RESP;
    if (sequence != awaited_) return WYX_BAD_QUORUM_MSG_SEQNUM;
    awaited_ = 0;
    return WYX_OK;
  }

 private:
  bool nodes_ = false;
  bool quorum_ = false;
  bool answers_ = false;       // each quorum notification
  std::uint64_t last_ = 0;     // sequence of the last one that is to be answered
  std::uint64_t awaited_ = 0;  // 0: none
};

}  // namespace gs
