#include "tools/gsctl/propose.h"

#include <random>

#include "tools/gsctl/group_facts.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

using std::chrono::duration;

constexpr double kFirstPause = 0.005;  // seconds, doubled with each collision
constexpr double kLongestPause = 0.5;

std::string rejection_cause(unsigned summary) {
  if (summary & WYX_EXPLICIT_REJECT) return "vote";
  if (summary & WYX_TIME_LIMIT_EXCEEDED) return "time_limit";
  return summary & WYX_PROVIDER_FAILED ? "voter_failed" : "default_vote";
}

class Proposer : public Member {
 public:
  Proposer(Loop& loop, const Proposal& proposal, const Settings& settings,
           const std::function<wyx_rc_t(Member&)>& submit)
      : Member(loop, proposal.group, proposal.name),
        proposal_(proposal),
        settings_(settings),
        submit_(submit),
        votes_(proposal.group) {}

  /// Whatever ended the command, nobody is to take its end for a failure.
  ~Proposer() override {
    if (getClientState() == zelt_gscl::GS_IAM_JOINED) goodbyeGroup();
  }

  /// What a connection that is lost, or time that is over, leaves behind.
  std::string left_open() const {
    return proposed_ ? "unknown whether it was approved: look with gsctl get or watch" : "nothing was proposed";
  }
  /// None: there is no outcome yet.
  std::optional<Status> outcome() const { return outcome_; }

 private:
  void approved(const wyx_approved_notification_t& n) override {
    if (n.gs_protocol_type == WYX_JOIN && is_me(n.gs_proposal->gs_changing_providers)) {
      if (n.gs_proposal->gs_current_providers->gs_count == 1) {
        throw Error(kRefused, "group '" + proposal_.group + "': " + explain(WYX_UNKNOWN_GROUP));
      }
      submit();
    } else if (n.gs_protocol_type == WYX_LEAVE && is_me(n.gs_proposal->gs_changing_providers)) {
      loop().stop();
    } else if (proposed_ && is_mine(*n.gs_proposal)) {
      tell_approval(n.gs_event_seqnum);
      end(kDone);
    }
  }

  void rejected(const wyx_rejected_notification_t& n) override {
    if (n.gs_protocol_type == WYX_JOIN && is_me(n.gs_proposal->gs_changing_providers)) {
      throw Error(kRefused,
                  "the members reject the join: " + gsctl::quoted(bytes_of(n.gs_proposal->gs_provider_message)));
    }
    if (!proposed_ || !is_mine(*n.gs_proposal)) return;
    tell_rejection(n);
    end(kRefused);
  }

  void announced(const wyx_announcement_notification_t& n) override {
    if (n.gs_summary_code & WYX_GROUP_DISSOLVED) throw Error(kRefused, "expelled from the group; " + left_open());
  }

  void refused(const wyx_delayed_error_notification_t& n) override {
    if (outcome_) return loop().stop();
    if (!proposed_) throw Error(kRefused, "cannot join: " + explain(n.gs_delayed_return_code));
    answered(n.gs_delayed_return_code);
  }

  void submit() {
    ++attempts_;
    proposed_ = true;
    answered(submit_(*this));
  }

  void answered(wyx_rc_t rc) {
    if (rc == WYX_OK) return;
    proposed_ = false;
    if (rc == WYX_NO_INIT) return;  // it will be said that the session is lost
    if (rc != WYX_COLLIDE || attempts_ > proposal_.retries) {
      throw Error(kRefused,
                  explain(rc) + (attempts_ > 1 ? " (tried " + std::to_string(attempts_) + " times)" : ""));
    }
    pause_ = loop().after(pause_before(attempts_), [this] { submit(); });
  }

  void tell_approval(std::uint64_t event) {
    if (settings_.json) {
      print_json(record("approved", event));
    } else {
      print_line("approved, event " + std::to_string(event));
    }
  }

  void tell_rejection(const wyx_rejected_notification_t& n) {
    const std::vector<Rejecter> by = votes_.rejecters(n.gs_event_seqnum);
    const std::string message = bytes_of(n.gs_proposal->gs_provider_message);
    const std::string cause = rejection_cause(static_cast<unsigned>(n.gs_summary_code));
    if (settings_.json) {
      Json object = record("rejected", n.gs_event_seqnum);
      object["cause"] = cause;
      object["by"] = Json::array();
      for (const Rejecter& voter : by) {
        object["by"].push_back(to_json(voter.id));
        set_bytes(object["by"].back(), "name", voter.name);
      }
      set_bytes(object, "message", message);
      print_json(object);
      return;
    }
    std::string text = "rejected";
    for (const Rejecter& voter : by) {
      text += (&voter == by.data() ? " by " : ", ") + voter.name + " (" + to_text(voter.id) + ")";
    }
    if (cause != "vote") text += " (" + cause + ")";
    complain(message.empty() ? text : text + ": " + gsctl::quoted(message));
  }

  Json record(const char* what, std::uint64_t event) {
    Json object = {{"time", utc_text()}};
    set_bytes(object, "group", proposal_.group);
    object["outcome"] = what;
    object["event"] = event;
    object["member"] = to_json(getId());
    object["attempts"] = attempts_;
    return object;
  }

  /// Out of the group in order, so that nobody takes it for a failure.
  void end(Status outcome) {
    outcome_ = outcome;
    proposed_ = false;
    leaving_ = loop().after(kLeaveTime, [this] { loop().stop(); });
    if (leaveGroup(0U, WYX_1_PHASE, 0) != WYX_OK) loop().stop();
  }

  const Proposal& proposal_;
  const Settings& settings_;
  const std::function<wyx_rc_t(Member&)>& submit_;
  VoteWatch votes_;
  bool proposed_ = false;  // and no outcome yet
  int attempts_ = 0;
  std::optional<Status> outcome_;
  Loop::Handle pause_;
  Loop::Handle leaving_;
};

}  // namespace

void add_proposal_options(CLI::App& command, Proposal& proposal) {
  command.add_option("GROUP", proposal.group, "Its name")->type_name("")->required();
  command.add_option("--name", proposal.name, "The name to join with")->capture_default_str()->type_name("NAME");
  command.add_option("--retry", proposal.retries, "Tries after one that collided with another change")
      ->capture_default_str()
      ->type_name("N")
      ->check(CLI::Range(0, 1'000'000));
  command.add_option("--vote-time", proposal.vote_time, "What voters have for each phase; 0: no limit")
      ->capture_default_str()
      ->type_name("SECONDS");
}

duration<double> pause_before(int attempt) {
  static std::minstd_rand source{std::random_device()()};
  const double longest = std::min(kFirstPause * static_cast<double>(1U << std::min(attempt, 16)), kLongestPause);
  return duration<double>(std::uniform_real_distribution<double>(longest / 2, longest)(source));
}

int propose(const Proposal& proposal, const Settings& settings, const std::function<wyx_rc_t(Member&)>& submit) {
  check_group(proposal.group);
  Loop loop;
  Session session(loop);
  session.open();
  require_group(loop, proposal.group);
  Proposer proposer(loop, proposal, settings, submit);
  session.on_lost([&] {
    if (!proposer.outcome()) throw Error(kLost, "the daemon went away: " + proposer.left_open());
    loop.stop();
  });
  Loop::Handle limit;
  if (settings.timeout) {
    limit = loop.after(duration<double>(*settings.timeout),
                       [&] { throw Error(kTimeOver, "time is over: " + proposer.left_open()); });
  }
  proposer.ask_to_join();
  loop.run();
  return *proposer.outcome();
}

}  // namespace gsctl
