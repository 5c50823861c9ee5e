// gsctl join: be a member of a group until interrupted, vote, and do what standard input says.
#include <unistd.h>

#include <array>
#include <deque>
#include <sstream>

#include "tools/gsctl/change.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/propose.h"

namespace gsctl {
namespace {

using std::chrono::duration;

constexpr int kTriesOfLine = 6;

struct Options {
  std::string group;
  std::optional<short> instance;
  std::string name;
  bool reject = false;
  std::string vote_command;
  unsigned short vote_time = kVoteTime;
};

class Joined : public Member {
 public:
  Joined(Loop& loop, const Options& options, const Settings& settings)
      : Member(loop, options.group, options.name), options_(options), settings_(settings) {}
  ~Joined() override {
    if (getClientState() == zelt_gscl::GS_IAM_JOINED) goodbyeGroup();
  }

  /// Nothing is to come after it.
  void leave();
  void until_joined(Loop::Handle limit) { limit_ = std::move(limit); }

 private:
  void asked(const wyx_n_phase_notification_t& n) override;
  void approved(const wyx_approved_notification_t& n) override;
  void rejected(const wyx_rejected_notification_t& n) override;
  void announced(const wyx_announcement_notification_t& n) override;
  void refused(const wyx_delayed_error_notification_t& n) override;

  void say(Change change) { print(change, settings_.json); }
  void cast(wyx_vote_value_t value, const std::string& message);
  void ask_command(const wyx_n_phase_notification_t& n, const Change& question);
  void say_left(Change change, const wyx_proposal_t& proposal);
  void read_lines();
  void next_line();
  wyx_rc_t obey(const std::string& line);
  wyx_rc_t expel(std::istringstream& words);
  void line_answered(wyx_rc_t rc);
  void line_done();

  const Options& options_;
  const Settings& settings_;
  std::unique_ptr<Shell> voter_;
  std::string text_;               // of standard input, not yet a line
  std::deque<std::string> lines_;  // the first is what is being done
  bool doing_ = false;
  int tries_ = 0;
  Loop::Handle input_, pause_, limit_, leaving_;
};

Change change_of(const std::string& group, const char* what, std::uint64_t event, const wyx_proposal_t& proposal) {
  return {group, what, event, {proposal.gs_proposed_by}, "", {}, {}};
}

/// The state value, the message, or nothing, that a proposal is about.
std::optional<std::string> bytes_of_proposal(const wyx_proposal_t& proposal) {
  if (proposal.gs_proposed_state_value != nullptr) return bytes_of(proposal.gs_proposed_state_value);
  if (proposal.gs_provider_message != nullptr) return bytes_of(proposal.gs_provider_message);
  return std::nullopt;
}

void Joined::asked(const wyx_n_phase_notification_t& n) {
  const wyx_proposal_t& proposal = *n.gs_proposal;
  Change question = change_of(options_.group, "asked", n.gs_event_seqnum, proposal);
  question.why =
      protocol_name(n.gs_protocol_type) + ", phase " + std::to_string(proposal.gs_phase_info.gs_phase_number);
  question.bytes = bytes_of_proposal(proposal);
  say(question);
  if (is_mine(proposal) || getClientState() == zelt_gscl::GS_IAM_JOINING) {
    cast(WYX_VOTE_APPROVE, "");
  } else if (!options_.vote_command.empty()) {
    ask_command(n, question);
  } else if (options_.reject) {
    cast(WYX_VOTE_REJECT, "rejected by " + options_.name);
  } else {
    cast(WYX_VOTE_APPROVE, "");
  }
}

void Joined::cast(wyx_vote_value_t value, const std::string& message) {
  auto record = record_of<wyx_provider_message_t>(message);
  const wyx_rc_t rc = vote(value, WYX_NULL_VOTE, nullptr, message.empty() ? nullptr : &record);
  if (rc != WYX_OK && rc != WYX_NO_INIT) complain("vote: " + explain(rc));
}

void Joined::ask_command(const wyx_n_phase_notification_t& n, const Change& question) {
  constexpr std::array<wyx_vote_value_t, 3> kVotes = {WYX_VOTE_APPROVE, WYX_VOTE_REJECT, WYX_VOTE_CONTINUE};
  wyx_limits limits{};
  zelt_gscl_V1::GSController::getLimits(&limits);
  Job job = job_of(question, options_.vote_command);
  job.environment.push_back("GS_PROTOCOL=" + protocol_name(n.gs_protocol_type));
  job.environment.push_back("GS_PHASE=" + std::to_string(n.gs_proposal->gs_phase_info.gs_phase_number));
  job.environment.push_back("GS_MEMBER=" + to_text(getId()));
  const auto ended = [this, kVotes](int status, std::string output) {
    while (output.ends_with('\n')) output.pop_back();
    const bool known = status >= 0 && static_cast<std::size_t>(status) < kVotes.size();
    if (known) return cast(kVotes[static_cast<std::size_t>(status)], output);
    cast(WYX_VOTE_REJECT, "the program that votes ended with status " + std::to_string(status));
  };
  voter_ =
      std::make_unique<Shell>(loop(), job, static_cast<std::size_t>(limits.max_provider_message_length), ended);
}

void Joined::approved(const wyx_approved_notification_t& n) {
  const wyx_proposal_t& proposal = *n.gs_proposal;
  voter_.reset();
  Change change = change_of(options_.group, "joined", n.gs_event_seqnum, proposal);
  const bool me = is_me(proposal.gs_changing_providers);
  switch (n.gs_protocol_type) {
    case WYX_JOIN:
      change.who = members_of(proposal.gs_changing_providers);
      change.members = members_of(proposal.gs_current_providers);
      break;
    case WYX_LEAVE:
    case WYX_FAILURE_LEAVE:
    case WYX_EXPEL:
      say_left(change, proposal);
      if (me && n.gs_protocol_type == WYX_LEAVE) return loop().stop();
      if (is_mine(proposal)) line_done();
      return;
    case WYX_STATE_VALUE_CHANGE:
      change.what = "state";
      change.bytes = bytes_of(proposal.gs_current_state_value);
      break;
    case WYX_PROVIDER_MESSAGE:
      change.what = "message";
      change.bytes = bytes_of(proposal.gs_provider_message);
      break;
    default:
      change.what = "approved";
      change.why = protocol_name(n.gs_protocol_type);
  }
  say(change);
  if (n.gs_protocol_type == WYX_JOIN && me) {
    limit_.reset();
    input_ = loop().on_readable(STDIN_FILENO, [this] { read_lines(); });
  } else if (is_mine(proposal)) {
    line_done();
  }
}

void Joined::say_left(Change change, const wyx_proposal_t& proposal) {
  change.what = "left";
  change.members = members_of(proposal.gs_current_providers);
  const Members who = members_of(proposal.gs_changing_providers);
  for (std::size_t i = 0; i < who.size(); ++i) {
    change.who = {who[i]};
    change.why = proposal.gs_leave_info == nullptr
                     ? "gone"
                     : leave_reason(proposal.gs_leave_info->gs_leave_codes[i].gs_voluntary_or_failure);
    say(change);
  }
}

void Joined::rejected(const wyx_rejected_notification_t& n) {
  voter_.reset();
  Change change = change_of(options_.group, "rejected", n.gs_event_seqnum, *n.gs_proposal);
  change.why = protocol_name(n.gs_protocol_type);
  const std::string message = bytes_of(n.gs_proposal->gs_provider_message);
  if (!message.empty()) change.bytes = message;
  if (n.gs_protocol_type == WYX_JOIN && is_me(n.gs_proposal->gs_changing_providers)) {
    throw Error(kRefused, "the members reject the join: " + gsctl::quoted(message));
  }
  say(change);
  if (is_mine(*n.gs_proposal)) line_done();
}

void Joined::announced(const wyx_announcement_notification_t& n) {
  if (n.gs_summary_code & WYX_GROUP_DISSOLVED)
    throw Error(kRefused, "expelled from group '" + options_.group + "'");
  if (n.gs_summary_code & WYX_RESPONSIVENESS_NO_RESPONSE) {
    say({options_.group, "silent", {}, members_of(n.gs_announcement), "", {}, {}});
  } else if (n.gs_summary_code & WYX_RESPONSIVENESS_RESPONSE) {
    say({options_.group, "responds", {}, members_of(n.gs_announcement), "", {}, {}});
  }
}

void Joined::refused(const wyx_delayed_error_notification_t& n) {
  if (n.gs_protocol_type == WYX_JOIN) throw Error(kRefused, "cannot join: " + explain(n.gs_delayed_return_code));
  if (leaving_) return loop().stop();
  line_answered(n.gs_delayed_return_code);
}

void Joined::leave() {
  input_.reset();
  leaving_ = loop().after(kLeaveTime, [this] { loop().stop(); });
  if (leaveGroup(0U, WYX_1_PHASE, 0) != WYX_OK) loop().stop();
}

void Joined::read_lines() {
  std::array<char, 4096> bytes{};
  const ssize_t got = read(STDIN_FILENO, bytes.data(), bytes.size());
  if (got <= 0) return input_.reset();  // the member stays
  text_.append(bytes.data(), static_cast<std::size_t>(got));
  for (std::size_t end = 0; (end = text_.find('\n')) != std::string::npos; text_.erase(0, end + 1)) {
    if (end > 0) lines_.push_back(text_.substr(0, end));
  }
  if (!doing_) next_line();
}

void Joined::next_line() {
  if (lines_.empty() || leaving_) return;
  doing_ = true;
  ++tries_;
  const wyx_rc_t rc = obey(lines_.front());
  if (rc != WYX_OK) line_answered(rc);
}

wyx_rc_t Joined::obey(const std::string& line) {
  std::istringstream words(line);
  std::string verb;
  words >> verb;
  const std::string text = line.size() > verb.size() ? line.substr(verb.size() + 1) : "";
  if (verb == "state")
    return changeStateValue(record_of<wyx_state_value_t>(text), WYX_N_PHASE, options_.vote_time);
  if (verb == "say") return send_message(record_of<wyx_provider_message_t>(text), WYX_N_PHASE, options_.vote_time);
  if (verb == "expel") return expel(words);
  if (line == "leave") {
    leave();
    return WYX_OK;
  }
  complain(gsctl::quoted(line) + ": say state TEXT, say TEXT, expel ID..., or leave");
  line_done();
  return WYX_OK;
}

wyx_rc_t Joined::expel(std::istringstream& words) {
  Members members;
  for (std::string id; words >> id;) {
    try {
      members.push_back(id_from(id, Session::node()));
    } catch (const Error& error) {
      complain(error.what());
      line_done();
      return WYX_OK;
    }
  }
  wyx_expel_request_t request{};
  request.gs_num_phases = WYX_N_PHASE;
  request.gs_time_limit = options_.vote_time;
  request.gs_expel_list = {static_cast<unsigned>(members.size()), members.data()};
  return expelMembers(&request);
}

void Joined::line_answered(wyx_rc_t rc) {
  if (rc == WYX_NO_INIT || !doing_) return;
  if (rc == WYX_COLLIDE && tries_ < kTriesOfLine) {
    pause_ = loop().after(pause_before(tries_), [this] { next_line(); });
    return;
  }
  complain(gsctl::quoted(lines_.front()) + ": " + explain(rc));
  line_done();
}

void Joined::line_done() {
  if (!doing_) return;
  doing_ = false;
  tries_ = 0;
  lines_.pop_front();
  pause_ = loop().after(duration<double>(0), [this] { next_line(); });
}

int join(const Options& asked, const Settings& settings) {
  check_group(asked.group);
  Options options = asked;
  if (options.name.empty()) options.name = "gsctl";
  Loop loop;
  Session session(loop);
  session.open();
  end_when_lost(session, "the daemon went away, and the membership with it");
  Joined member(loop, options, settings);
  const auto interrupts = on_interrupt(loop, [&](int) { member.leave(); });
  const auto reader = when_unread(loop, [&] { member.leave(); });
  member.until_joined(end_in_time(loop, settings, "time is over: the join is not approved yet"));
  member.ask_to_join(options.instance);
  loop.run();
  return kDone;
}

}  // namespace

Run add_join(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->group, "Its name; made if there is none")->type_name("")->required();
  command.add_option("--instance", options->instance, "The instance number; one that is free without it")
      ->type_name("N");
  command.add_option("--name", options->name, "The name to join with")->type_name("NAME");
  CLI::Option* vote = command.add_option_function<std::string>(
      "--vote", [options](const std::string& text) { options->reject = text == "reject"; }, "How to vote");
  vote->type_name("approve|reject")->check(CLI::IsMember({"approve", "reject"}));
  command.add_option("--vote-with", options->vote_command, "Ask this, run by the shell, for each vote")
      ->type_name("CMD")
      ->excludes(vote);
  command.add_option("--vote-time", options->vote_time, "What voters have for each phase; 0: no limit")
      ->capture_default_str()
      ->type_name("SECONDS");
  command.footer(
      "Standard input: state TEXT, say TEXT, expel ID..., leave; a line each. Its end changes nothing.");
  return [options](const Settings& settings) { return join(*options, settings); };
}

}  // namespace gsctl
