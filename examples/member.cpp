// A member of a group. It joins, votes, does what it is told on standard input, and prints a line for everything
// that the group decides.
//
//   member GROUP INSTANCE [VETO]
//
//   state TEXT   propose TEXT as the group's state; all members vote on it in two phases
//   say TEXT     send TEXT to all members
//   leave        leave the group and end
//
// A member rejects a state that is equal to VETO. The end of the input ends it too, without a good-bye.
#include <poll.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "examples/commands.h"
#include "examples/say.h"
#include "gscl/gscl.h"

using zelt_gscl_V1::GSController;
using zelt_gscl_V1::GSProvider;

class Member : public GSProvider {
 public:
  Member(const char* group, short instance, std::string veto)
      : GSProvider(group, instance, nullptr), veto_(veto) {}

  // The members vote: on to a second phase first, then yes, and no to what this one has a veto on.
  void nPhaseCb(const wyx_n_phase_notification_t* n) override {
    const wyx_proposal_t& proposal = *n->gs_proposal;
    const int phase = proposal.gs_phase_info.gs_phase_number;
    const std::string state = to_text(proposal.gs_proposed_state_value);
    say(n->gs_event_seqnum, proposer(proposal) + " proposes state " + state + ", phase " + std::to_string(phase));

    wyx_vote_value_t mine = phase == 1 ? WYX_VOTE_CONTINUE : WYX_VOTE_APPROVE;
    if (state == '"' + veto_ + '"') mine = WYX_VOTE_REJECT;
    vote(mine, WYX_NULL_VOTE, nullptr, nullptr);
  }

  void approvedCb(const wyx_approved_notification_t* n) override {
    say(n->gs_event_seqnum, what_happened(n->gs_protocol_type, *n->gs_proposal));
    const bool leads = is_oldest(n->gs_proposal->gs_current_providers);
    if (leads && !leads_) say(n->gs_event_seqnum, std::to_string(getInstanceNumber()) + " leads");
    leads_ = leads;
  }

  void rejectedCb(const wyx_rejected_notification_t* n) override {
    say(n->gs_event_seqnum, "rejected; the state stays " + to_text(n->gs_proposal->gs_current_state_value));
  }

  void announcementCb(const wyx_announcement_notification_t* n) override {
    say(0, std::string("announcement: ") + zelt_gscl::gscl_summary_code_names(n->gs_summary_code));
  }

  void delayedErrorCb(const wyx_delayed_error_notification_t* n) override {
    say(0, std::string("refused: ") + zelt_gscl::gscl_rc_name(n->gs_delayed_return_code));
  }

 private:
  static std::string proposer(const wyx_proposal_t& proposal) {
    return std::to_string(proposal.gs_proposed_by._gs_provider_info._gs_instance_number);
  }

  // The members' list begins with the oldest, and is the same at all: who is first there may lead with no further
  // vote.
  bool is_oldest(const wyx_membership_t* members) {
    return members && members->gs_count > 0 &&
           members->gs_providers[0]._gs_provider_info._gs_instance_number == getInstanceNumber();
  }

  static std::string why_gone(const wyx_leave_info_t* info) {
    std::string names;
    for (unsigned i = 0; info && i < info->gs_count; i++) {
      const unsigned code = info->gs_leave_codes[i].gs_voluntary_or_failure;
      if (code & WYX_PROVIDER_FAILURE) names += " WYX_PROVIDER_FAILURE";
      if (code & WYX_HOST_FAILURE) names += " WYX_HOST_FAILURE";
      if (code & WYX_HOST_LEAVE_DUE_TO_STOP) names += " WYX_HOST_LEAVE_DUE_TO_STOP";
    }
    return names;
  }

  static std::string what_happened(wyx_request_t protocol, const wyx_proposal_t& proposal) {
    const std::string members = "; members: " + to_text(proposal.gs_current_providers);
    const std::string who = to_text(proposal.gs_changing_providers);
    switch (protocol) {
      case WYX_JOIN:
        return who + " joins" + members;
      case WYX_LEAVE:
        return who + " leaves" + members;
      case WYX_FAILURE_LEAVE:
        return who + " has failed," + why_gone(proposal.gs_leave_info) + members;
      case WYX_STATE_VALUE_CHANGE:
        return "approved; the state is " + to_text(proposal.gs_current_state_value);
      case WYX_PROVIDER_MESSAGE:
        return proposer(proposal) + " says " + to_text(proposal.gs_provider_message);
      default:
        return zelt_gscl::gscl_request_type_name(protocol);
    }
  }

  const std::string veto_;
  bool leads_ = false;
};

// Does what one line says and gives the group's first answer; the outcome comes to the callbacks.
static wyx_rc_t obey(Member& member, std::string line) {
  if (line == "leave") return member.leaveGroup(0u, WYX_1_PHASE, 0);
  const size_t space = line.find(' ');
  if (space == std::string::npos) return WYX_BAD_PARAMETER;
  std::string text = line.substr(space + 1);
  const int length = static_cast<int>(text.size());
  if (line.compare(0, space, "state") == 0) {
    return member.changeStateValue(wyx_state_value_t{length, &text[0]}, WYX_N_PHASE, 10);
  }
  if (line.compare(0, space, "say") == 0) {
    return member.send_message(wyx_provider_message_t{length, &text[0]}, WYX_1_PHASE, 0);
  }
  return WYX_BAD_PARAMETER;
}

static int fail(const char* what, wyx_rc_t rc) {
  std::fprintf(stderr, "member: %s: %s\n", what, zelt_gscl::gscl_rc_name(rc));
  return 1;
}

int main(int argc, char** argv) {
  if (argc < 3 || argc > 4) {
    std::fprintf(stderr, "usage: member GROUP INSTANCE [VETO]\n");
    return 2;
  }
  GSController controller;
  wyx_rc_t rc = controller.initialize();
  if (rc != WYX_OK) return fail("no connection to the daemon", rc);
  Member member(argv[1], static_cast<short>(std::atoi(argv[2])), argc > 3 ? argv[3] : "");
  rc = member.joinGroup();
  if (rc != WYX_OK) return fail("join", rc);

  Commands commands;
  while (member.getClientState() != zelt_gscl::GS_IAM_IDLE) {
    pollfd ready[] = {{controller.getGSDescriptor(), POLLIN, 0}, {commands.descriptor(), POLLIN, 0}};
    if (poll(ready, 2, -1) < 0) return 1;
    if (ready[0].revents && (rc = controller.dispatch(WYX_NON_BLOCKING)) != WYX_OK) return fail("dispatch", rc);
    if (ready[1].revents && !commands.read_some()) break;
    for (std::string line; commands.next(&line);) {
      if ((rc = obey(member, line)) != WYX_OK) fail(line.c_str(), rc);
    }
  }
  return 0;
}
