#include "tools/gsctl/candidate.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "common/command_line.h"
#include "tools/gsctl/keeper.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

using std::chrono::duration;

constexpr duration<double> kRestartPause(1);  // so that a CMD that fails at once does not fill the host
constexpr duration<double> kCollisionPause(0.02);
constexpr duration<double> kTurn(1);  // what each member leaves the one before it to expel one that hangs
constexpr int kSignalled = 128;

/// How long CMD may run on after the daemon has last asked whether this process runs. The daemon asks every second
/// and announces nobody who was asked for the last time less than `responsive` seconds before; so CMD is dead
/// before another candidate starts its own.
BootTime lease(unsigned short responsive) {
  constexpr BootTime kShortest(1500);  // a ping may be a little late
  return std::max<BootTime>(std::chrono::seconds(responsive), kShortest);
}

/// Events come one by one, but what is done is decided by settle(), when all that had arrived is known: a
/// candidate that wakes up late must not act on what is over.
class Candidate : public Member {
 public:
  Candidate(Loop& loop, Session& session, Keeper& keeper, const Candidacy& candidacy, const Settings& settings)
      : Member(loop, candidacy.group, candidacy.name),
        session_(session),
        keeper_(keeper),
        candidacy_(candidacy),
        settings_(settings) {}
  /// What it runs is ended before another can lead.
  ~Candidate() override {
    keeper_.end();
    if (getClientState() == zelt_gscl::GS_IAM_JOINED) goodbyeGroup();
  }

  int run();
  /// The daemon has asked whether this process runs.
  void extend_lease();

 private:
  enum class Command { kNone, kStarting, kRunning, kStopping };

  void approved(const wyx_approved_notification_t& n) override;
  void rejected(const wyx_rejected_notification_t& n) override;
  void announced(const wyx_announcement_notification_t& n) override;
  void refused(const wyx_delayed_error_notification_t& n) override;
  void be_out(Status status, const std::string& reason);
  void lost();
  void interrupted(int signal);
  void hear(const KeeperNews& news);
  void command_ended(int status);
  void settle();
  void enter();
  void start();
  void expel_silent();
  void expel();
  bool is_silent(const wyx_provider_t& id) const {
    return std::find(silent_.begin(), silent_.end(), id) != silent_.end();
  }
  Members silent_others();
  void end(int status) {
    if (!ending_) ending_ = status;
  }
  bool lease_holds() const { return !deadline_ || boot_time() < *deadline_; }
  void report(const char* change, const Json& more, const std::string& text);

  Session& session_;
  Keeper& keeper_;
  const Candidacy& candidacy_;
  const Settings& settings_;
  bool connected_ = true;
  Members members_;
  std::optional<std::uint64_t> fence_;  // this member is the oldest, since that event
  Members silent_;                      // members that are announced not to respond
  std::optional<BootTime> deadline_;    // of the lease
  Command command_ = Command::kNone;
  std::uint64_t command_fence_ = 0;
  std::optional<int> ending_;
  bool interrupted_ = false;
  bool output_gone_ = false;
  Loop::Handle limit_, pause_, expel_;
};

int Candidate::run() {
  session_.on_lost([this] { lost(); });
  session_.on_delivered([this] { settle(); });
  const auto news = loop().on_readable(keeper_.descriptor(), [this] {
    while (const auto told = keeper_.news()) hear(*told);
    settle();
  });
  const auto interrupts = on_interrupt(loop(), [this](int signal) { interrupted(signal); });
  if (settings_.timeout) {
    limit_ = loop().after(duration<double>(*settings_.timeout), [this] {
      complain("time is over: others lead '" + candidacy_.group + "'");
      end(kTimeOver);
      settle();
    });
  }
  extend_lease();
  settle();
  loop().run();
  return *ending_;
}

void Candidate::approved(const wyx_approved_notification_t& n) {
  const wyx_proposal_t& proposal = *n.gs_proposal;
  const bool out = n.gs_protocol_type == WYX_LEAVE || n.gs_protocol_type == WYX_EXPEL ||
                   n.gs_protocol_type == WYX_FAILURE_LEAVE;
  if (out && is_me(proposal.gs_changing_providers)) return be_out(kRefused, "expelled from the group");
  members_ = members_of(proposal.gs_current_providers);
  const bool oldest = !members_.empty() && members_.front() == getId();
  if (!oldest) {
    fence_.reset();
  } else if (!fence_) {
    fence_ = n.gs_event_seqnum;
  }
}

void Candidate::rejected(const wyx_rejected_notification_t& n) {
  if (n.gs_protocol_type != WYX_JOIN || !is_me(n.gs_proposal->gs_changing_providers)) return;
  throw Error(kRefused,
              "the members reject the join: " + gsctl::quoted(bytes_of(n.gs_proposal->gs_provider_message)));
}

void Candidate::announced(const wyx_announcement_notification_t& n) {
  if (n.gs_summary_code & WYX_GROUP_DISSOLVED) return be_out(kRefused, "expelled from the group");
  for (const wyx_provider_t& id : members_of(n.gs_announcement)) {
    std::erase(silent_, id);
    if (n.gs_summary_code & WYX_RESPONSIVENESS_NO_RESPONSE) silent_.push_back(id);
  }
}

void Candidate::refused(const wyx_delayed_error_notification_t& n) {
  if (n.gs_protocol_type != WYX_JOIN) return;  // an expulsion is tried again
  throw Error(kRefused, "cannot join group '" + candidacy_.group + "': " + explain(n.gs_delayed_return_code));
}

void Candidate::be_out(Status status, const std::string& reason) {
  members_.clear();
  silent_.clear();
  if (fence_ || command_ != Command::kNone) report("lost", {{"reason", reason}}, "no longer leads: " + reason);
  fence_.reset();
  if (candidacy_.restart || ending_) return;
  if (command_ == Command::kNone) complain("no candidate any more: " + reason);
  end(status);
}

void Candidate::lost() {
  connected_ = false;
  be_out(kLost, "the daemon is gone");
  if (!ending_) {
    session_.reopen([this] {
      connected_ = true;
      extend_lease();
      settle();
    });
  }
  settle();
}

void Candidate::interrupted(int signal) {
  interrupted_ = true;
  if (command_ == Command::kNone) end(kSignalled + signal);
  settle();
}

void Candidate::hear(const KeeperNews& news) {
  switch (news.kind) {
    case KeeperNews::kStarted:
      if (command_ == Command::kStarting) command_ = Command::kRunning;
      report("started", {{"pid", news.value}, {"fence", command_fence_}}, "");
      break;
    case KeeperNews::kNotRun:
      complain("cannot run " + candidacy_.command.front() + ": " + strerror(news.value));
      end(news.value == ENOENT ? kNotFound : kCannotRun);
      command_ = Command::kNone;
      break;
    case KeeperNews::kEnded:
      command_ended(news.value);
      break;
    case KeeperNews::kOverdue:
      if (command_ == Command::kStopping) return command_ended(news.value);
      goodbyeGroup();  // it is not known any more whether this member leads
      be_out(kRefused, "was not responsive");
      command_ = Command::kNone;
      break;
    case KeeperNews::kGone:
      throw Error(kRefused, "the process that keeps CMD was killed: CMD was killed with it");
  }
}

void Candidate::command_ended(int status) {
  const bool stopped = command_ == Command::kStopping;
  command_ = Command::kNone;
  report("ended", {{"status", status}, {"fence", command_fence_}}, "");
  if (interrupted_ || !candidacy_.restart) return end(status);
  if (stopped) return;
  complain("CMD ended with status " + std::to_string(status) + ": it is started again");
  pause_ = loop().after(kRestartPause, [this] {
    pause_.reset();
    settle();
  });
}

void Candidate::settle() {
  const bool rightful = fence_ && *fence_ == command_fence_ && !ending_ && !interrupted_;
  if ((command_ == Command::kStarting || command_ == Command::kRunning) && !rightful) {
    command_ = Command::kStopping;
    keeper_.stop();
  }
  if (command_ == Command::kNone && ending_) return loop().stop();
  if (!connected_ || ending_) return;
  expel_silent();
  if (command_ != Command::kNone) return;
  if (getClientState() == zelt_gscl::GS_IAM_IDLE) return enter();
  if (fence_ && !pause_ && lease_holds()) start();
}

void Candidate::enter() {
  const wyx_rc_t rc = try_to_join();
  if (rc == WYX_OK || rc == WYX_NO_INIT) return;  // of the latter the session tells
  throw Error(kRefused, "cannot join group '" + candidacy_.group + "': " + explain(rc));
}

void Candidate::start() {
  limit_.reset();
  command_ = Command::kStarting;
  command_fence_ = *fence_;
  const std::string fence = std::to_string(command_fence_);
  keeper_.start({"GS_GROUP=" + candidacy_.group, "GS_MEMBER=" + to_text(getId()), "GS_FENCE=" + fence}, deadline_);
  report("leading", {{"member", to_json(getId())}, {"fence", command_fence_}},
         to_text(getId()) + " leads '" + candidacy_.group + "', fence " + fence);
}

/// The oldest of those that respond does it; the others wait their turn, in case it does not.
void Candidate::expel_silent() {
  if (silent_others().empty()) return expel_.reset();
  if (expel_) return;
  const auto me = std::find(members_.begin(), members_.end(), getId());
  const auto turn = std::count_if(members_.begin(), me, [this](const auto& id) { return !is_silent(id); });
  expel_ = loop().after(kTurn * turn, [this] { expel(); });
}

void Candidate::expel() {
  Members out = silent_others();
  if (out.empty()) return expel_.reset();
  wyx_expel_request_t request{};
  request.gs_num_phases = WYX_1_PHASE;
  request.gs_expel_list = {static_cast<unsigned>(out.size()), out.data()};
  const bool accepted = expelMembers(&request) == WYX_OK;
  expel_ = loop().after(accepted ? kTurn : kCollisionPause, [this] { expel(); });
}

Members Candidate::silent_others() {
  Members found;
  for (const wyx_provider_t& id : members_) {
    if (is_silent(id) && !(id == getId())) found.push_back(id);
  }
  return found;
}

void Candidate::extend_lease() {
  if (!candidacy_.responsive) return;
  deadline_ = boot_time() + lease(*candidacy_.responsive);
  keeper_.extend(*deadline_);
}

void Candidate::report(const char* change, const Json& more, const std::string& text) {
  if (!settings_.json) {
    if (!text.empty()) complain(text);
    return;
  }
  if (output_gone_) return;
  Json object = {{"time", utc_text()}};
  set_bytes(object, "group", candidacy_.group);
  object["change"] = change;
  object.update(more);
  try {
    print_json(object);
  } catch (const OutputGone&) {
    output_gone_ = true;  // CMD is what counts
  }
}

}  // namespace

void add_candidacy_options(CLI::App& command, Candidacy& candidacy) {
  command.add_option("GROUP", candidacy.group, "Its name")->type_name("")->required();
  command.add_option("CMD", candidacy.command, "What to run, with its arguments, after --")
      ->type_name("")
      ->required();
  command.add_option("--name", candidacy.name, "The name to join with; CMD's without it")->type_name("NAME");
  command.add_option("--grace", candidacy.grace, "From SIGTERM to SIGKILL, where CMD has to end")
      ->capture_default_str()
      ->type_name("SECONDS")
      ->check(platform::between(0.0, 1e6));
  command
      .add_option("--responsive", candidacy.responsive,
                  "Have the group expel this candidate when it hangs for so long, and CMD killed")
      ->type_name("SECONDS")
      ->check(CLI::Range(1, 65535));
}

int stand(const Candidacy& asked, const Settings& settings) {
  check_group(asked.group);
  Candidacy candidacy = asked;
  if (candidacy.name.empty())
    candidacy.name = std::filesystem::path(candidacy.command.front()).filename().string();
  Keeper keeper({candidacy.command, duration<double>(candidacy.grace), !candidacy.restart});
  Loop loop;
  Session session(loop);
  Candidate candidate(loop, session, keeper, candidacy, settings);
  if (candidacy.responsive) session.be_responsive(*candidacy.responsive, [&] { candidate.extend_lease(); });
  session.open();
  return candidate.run();
}

}  // namespace gsctl
