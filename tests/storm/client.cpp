#include "storm/client.h"

#include <poll.h>
#include <sys/prctl.h>

#include <cstdio>
#include <functional>
#include <map>
#include <memory>
#include <random>
#include <sstream>
#include <string_view>
#include <vector>

#include "examples/commands.h"
#include "gscl/gscl.h"
#include "storm/board.h"

namespace storm {
namespace {

using zelt_gscl_V1::GSController;

constexpr int kBig = 64 * 1024;  // bytes of a big state value; the others have up to 200
constexpr int kBigGroup = 5;     // the one that has them
constexpr int kPause = 30;       // milliseconds between two requests at random, on average
constexpr int kMaxInstance = 32767;

std::string group_name(int group) { return "storm" + std::to_string(group); }

/// Groups of different kinds: one phase and n, batching and not, with time limits and without, vote results.
wyx_group_attributes_t attributes_of(int group, short version) {
  struct Kind {
    int batch;
    wyx_num_phases_t phases;
    wyx_time_limit_t limit;
    wyx_vote_value_t vote;
  };
  static constexpr Kind kKinds[kGroups] = {
      {WYX_NO_BATCHING, WYX_1_PHASE, 0, WYX_NULL_VOTE},
      {WYX_BATCH_BOTH, WYX_1_PHASE, 0, WYX_NULL_VOTE},
      {WYX_NO_BATCHING, WYX_N_PHASE, 1, WYX_NULL_VOTE},
      {WYX_BATCH_BOTH | WYX_COLLECT_ALL_RESULT, WYX_N_PHASE, 1, WYX_VOTE_APPROVE},
      {WYX_BATCH_LEAVES, WYX_N_PHASE, 0, WYX_VOTE_REJECT},
      {WYX_BATCH_JOINS, WYX_1_PHASE, 0, WYX_NULL_VOTE},
  };
  const Kind& kind = kKinds[group];
  wyx_group_attributes_t attributes{};
  attributes.gs_client_version = version;
  attributes.gs_batch_control = static_cast<wyx_batch_ctrl_t>(kind.batch);
  attributes.gs_num_phases = kind.phases;
  attributes.gs_source_reflection_num_phases = WYX_1_PHASE;
  attributes.gs_group_default_vote = kind.vote;
  attributes.gs_time_limit = kind.limit;
  return attributes;
}

/// The parts with spaces between them.
template <class First, class... Rest>
std::string words(const First& first, const Rest&... rest) {
  std::ostringstream out;
  out << first;
  ((out << ' ' << rest), ...);
  return out.str();
}

std::string hash_of(const char* bytes, int length) {
  const std::size_t hash = std::hash<std::string_view>()({bytes, static_cast<std::size_t>(length)});
  return std::to_string(length) + ":" + std::to_string(hash % 0xffffff);
}
std::string text(const wyx_state_value_t* v) { return v ? hash_of(v->gs_state, v->gs_length) : "-"; }
std::string text(const wyx_provider_message_t* v) { return v ? hash_of(v->gs_message, v->gs_length) : "-"; }
std::string text(const wyx_membership_t* members) {
  std::string all;
  for (unsigned i = 0; members && i < members->gs_count; i++) {
    all += (i ? "," : "") + std::to_string(members->gs_providers[i]._gs_provider_info._gs_instance_number);
  }
  return all.empty() ? "-" : all;
}
std::string text(const wyx_vote_results_t* results) {
  std::string all;
  for (unsigned i = 0; results && i < results->gs_count; i++) {
    const wyx_vote_result_t& r = *results->gs_vote_results[i];
    all += "/" + std::to_string(r.gs_voter._gs_provider_info._gs_instance_number) + "=" +
           std::to_string(r.gs_vote_value) + "," + std::to_string(r.gs_summary_code) + "," +
           text(r.gs_proposed_state_value) + "," + text(r.gs_provider_message);
  }
  return all.empty() ? "-" : all;
}

/// What all who share an event must have been told alike.
std::string rest_of(const wyx_proposal_t& p, wyx_request_t protocol, wyx_summary_code_t summary) {
  std::string rest = "summary=" + std::to_string(summary) +
                     ",phase=" + std::to_string(p.gs_phase_info.gs_phase_number) +
                     ",changed=" + std::to_string(p.gs_whats_changed) +
                     ",proposed=" + text(p.gs_proposed_state_value) + ",message=" + text(p.gs_provider_message) +
                     ",votes=" + text(p.gs_current_vote_results) + text(p.gs_changing_vote_results);
  for (unsigned i = 0; p.gs_leave_info && i < p.gs_leave_info->gs_count; i++) {
    const wyx_leave_code_entry_t& code = p.gs_leave_info->gs_leave_codes[i];
    rest += ",left=" + std::to_string(code.gs_voluntary_or_failure) + "/" +
            std::to_string(code.gs_voluntary_leave_code);
  }
  // Each of a batch reads its own id there.
  if (protocol == WYX_JOIN || protocol == WYX_LEAVE) return rest;
  return rest + ",by=" + std::to_string(p.gs_proposed_by._gs_provider_info._gs_instance_number);
}

/// What a client has at hand. A line of the log is one write, so that a kill leaves whole lines.
struct Surroundings {
  explicit Surroundings(const ClientSettings& settings)
      : board(map_board(settings.folder)),
        random(static_cast<std::uint32_t>(settings.seed)),
        log_(::open(
            (settings.folder + "/" + settings.role + "." + std::to_string(settings.serial) + ".log").c_str(),
            O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600)) {}
  Surroundings(const Surroundings&) = delete;
  Surroundings& operator=(const Surroundings&) = delete;
  ~Surroundings() { ::close(log_); }

  void log(const std::string& line) {
    const std::string whole = line + "\n";
    if (::write(log_, whole.data(), whole.size()) < 0) std::perror("storm: log");
  }
  int upto(int n) { return static_cast<int>(random() % static_cast<unsigned>(n + 1)); }
  bool chance(int percent) { return upto(99) < percent; }

  Board* board;
  std::mt19937 random;
  bool rally = false;

 private:
  int log_;
};

class Member : public zelt_gscl_V1::GSProvider {
 public:
  Member(Surroundings& env, int group)
      : GSProvider(group_name(group).c_str(), 0, nullptr), env_(env), group_(group) {}

  void act();
  std::string report() { return words("P", group_, joined() ? instance_ : 0, seqnum_, members_, open_.size()); }

  void nPhaseCb(const wyx_n_phase_notification_t* n) override {
    event('n', *n);
    cast_vote(n->gs_time_limit != 0);
  }
  void approvedCb(const wyx_approved_notification_t* n) override {
    event('a', *n);
    ended(n->gs_protocol_type, *n->gs_proposal);
    if (!env_.rally && env_.chance(2)) act();
  }
  void rejectedCb(const wyx_rejected_notification_t* n) override {
    event('r', *n);
    ended(n->gs_protocol_type, *n->gs_proposal);
  }
  void announcementCb(const wyx_announcement_notification_t* n) override {
    log("A", n->gs_summary_code);
    open_.clear();
  }
  void delayedErrorCb(const wyx_delayed_error_notification_t* n) override {
    log("D", n->gs_protocol_type, n->gs_delayed_return_code);
    open_.erase(n->gs_protocol_type);
  }

 private:
  bool joined() { return getClientState() == zelt_gscl::GS_IAM_JOINED; }
  template <class... What>
  void log(const char* mark, const What&... what) {
    env_.log(words(mark, group_, instance_, what...));
  }
  template <class Notification>
  void event(char kind, const Notification& n);
  void ended(wyx_request_t protocol, const wyx_proposal_t& proposal);
  void cast_vote(bool may_abstain);
  void join();
  void expel();
  void propose(int what);
  void asked(wyx_request_t protocol, wyx_rc_t rc) {
    if (rc != WYX_OK) return;
    log("R", protocol);
    open_[protocol] = true;
  }
  std::vector<char> bytes() {
    const bool big = group_ == kBigGroup && !env_.rally && env_.chance(20);
    return std::vector<char>(static_cast<std::size_t>(big ? kBig : env_.upto(200)),
                             static_cast<char>('a' + env_.upto(25)));
  }

  Surroundings& env_;
  const int group_;
  int instance_ = 0;
  std::uint64_t seqnum_ = 0;
  std::string members_ = "-";
  std::map<wyx_request_t, bool> open_;  // answered WYX_OK, and nothing has come of it yet
};

template <class Notification>
void Member::event(char kind, const Notification& n) {
  const wyx_proposal_t& p = *n.gs_proposal;
  seqnum_ = n.gs_event_seqnum;
  members_ = text(p.gs_current_providers);
  const bool updated = kind == 'a' && (p.gs_whats_changed & WYX_UPDATED_STATE_VALUE) != 0;
  log("E", p.gs_proposed_by._gs_provider_info._gs_instance_number, n.gs_event_seqnum, kind, n.gs_protocol_type,
      members_, text(p.gs_changing_providers), text(p.gs_current_state_value), updated,
      rest_of(p, n.gs_protocol_type, n.gs_summary_code));
}

void Member::ended(wyx_request_t protocol, const wyx_proposal_t& proposal) {
  if (proposal.gs_proposed_by._gs_provider_info._gs_instance_number == instance_) open_.erase(protocol);
}

void Member::cast_vote(bool may_abstain) {
  if (env_.rally) {
    vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr);
    return;
  }
  if (may_abstain && env_.chance(1)) return;
  const int dice = env_.upto(99);
  const wyx_vote_value_t mine = dice < 75 ? WYX_VOTE_APPROVE : dice < 93 ? WYX_VOTE_CONTINUE : WYX_VOTE_REJECT;
  const wyx_vote_value_t later = env_.chance(80) ? WYX_NULL_VOTE : WYX_VOTE_APPROVE;
  std::vector<char> value = bytes();
  const wyx_state_value_t state{static_cast<int>(value.size()), value.data()};
  const wyx_provider_message_t message{static_cast<int>(value.size()), value.data()};
  vote(mine, later, env_.chance(10) ? &state : nullptr, env_.chance(10) ? &message : nullptr);
}

void Member::join() {
  const int instance = ++env_.board->last_instance[group_];
  if (instance > kMaxInstance) return;
  std::string name = group_name(group_);
  wyx_group_attributes_t attributes = attributes_of(group_, static_cast<short>(1 + env_.upto(1)));
  attributes.gs_group_name = name.data();
  setGroupAttributes(&attributes);
  setInstanceNumber(static_cast<short>(instance));
  if (joinGroup() != WYX_OK) return;
  instance_ = instance;
  members_ = "-";
  open_.clear();
  open_[WYX_JOIN] = true;
  log("J");
}

void Member::expel() {
  zelt_gscl_V1::GSMembershipList members;
  if (!getMembers(members) || members.count() == 0) return;
  wyx_provider_t one = members.at(env_.upto(members.count() - 1));
  wyx_expel_request_t request{};
  request.gs_num_phases = env_.chance(50) ? WYX_1_PHASE : WYX_N_PHASE;
  request.gs_time_limit = 1;
  request.gs_expel_list = {1, &one};
  asked(WYX_EXPEL, expelMembers(&request));
}

void Member::propose(int what) {
  const wyx_num_phases_t phases = env_.chance(50) ? WYX_1_PHASE : WYX_N_PHASE;
  const auto limit = static_cast<wyx_time_limit_t>(env_.upto(2));
  std::vector<char> value = bytes();
  const int length = static_cast<int>(value.size());
  if (what == 0) {
    std::string name = group_name(group_);
    wyx_group_attributes_t attributes = attributes_of(group_, static_cast<short>(1 + env_.upto(1)));
    attributes.gs_group_name = name.data();
    asked(WYX_GROUP_ATTRIBUTE_CHANGE, change_attributes(attributes, phases, limit));
  } else if (what < 10) {
    asked(WYX_PROVIDER_MESSAGE, send_message(wyx_provider_message_t{length, value.data()}, phases, limit));
  } else {
    asked(WYX_STATE_VALUE_CHANGE, changeStateValue(wyx_state_value_t{length, value.data()}, phases, limit));
  }
}

void Member::act() {
  if (getClientState() == zelt_gscl::GS_IAM_IDLE) return join();
  if (!joined() || env_.rally) return;
  const int dice = env_.upto(99);
  if (dice < 6) return asked(WYX_LEAVE, leaveGroup(7, env_.chance(50) ? WYX_1_PHASE : WYX_N_PHASE, 1));
  if (dice < 9) return expel();
  if (dice < 12) {
    if (goodbyeGroup() != WYX_OK) return;
    log("G");
    return open_.clear();
  }
  propose(env_.upto(19));
}

class Watcher : public zelt_gscl_V1::GSSubscriber {
 public:
  Watcher(Surroundings& env, int group, bool persistent)
      : GSSubscriber(group_name(group).c_str(),
                     static_cast<wyx_subscription_ctrl_t>(WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP |
                                                          (persistent ? WYX_SUBSCRIBE_PERSISTENCE : 0))),
        env_(env),
        group_(group) {}

  void act() {
    const bool idle = getClientState() == zelt_gscl::GS_IAM_IDLE;
    if (!idle && !env_.rally && env_.chance(1)) unsubscribeGroup();
    if (!idle || subscribeGroup() != WYX_OK) return;
    env_.log(words("B", group_, ++serial_));
    members_ = "-";
  }
  std::string report() { return words("T", group_, members_); }

  void subscribeCb(const wyx_subscription_notification_t* n) override {
    if (n->gs_full_membership) members_ = text(n->gs_full_membership);
    env_.log(words("T", group_, serial_, n->gs_event_seqnum, n->gs_subscription_type, text(n->gs_full_membership),
                   text(n->gs_changing_membership), text(n->gs_state_value)));
  }

 private:
  Surroundings& env_;
  const int group_;
  int serial_ = 0;
  std::string members_ = "-";
};

class Client {
 public:
  explicit Client(const ClientSettings& settings) : settings_(settings), env_(settings) {
    const bool subscribes = settings.role == "subscriber";
    for (int group = 0; group < kGroups; group++) {
      if (subscribes) watchers_.push_back(std::make_unique<Watcher>(env_, group, env_.chance(50)));
      if (!subscribes) members_.push_back(std::make_unique<Member>(env_, group));
    }
  }
  int run() {
    while (!over_ && env_.board) {
      if (open_session()) serve();
    }
    return env_.board ? 0 : 1;
  }

 private:
  bool open_session();
  void serve();
  void obey(const std::string& line);
  void leave_behind();
  void act_at_random();
  /// Also does what it was told meanwhile.
  bool readable(int milliseconds);

  const ClientSettings settings_;
  Surroundings env_;
  GSController controller_;  // before its clients: they enter themselves with it
  std::vector<std::unique_ptr<Member>> members_;
  std::vector<std::unique_ptr<Watcher>> watchers_;
  Commands commands_;
  bool over_ = false;
};

/// A session that is known to be with one life of the daemon.
bool Client::open_session() {
  const int life = env_.board->life;
  const bool opened = controller_.initialize() == WYX_OK;
  if (opened && env_.board->life == life) {
    env_.log("S " + std::to_string(life));
    return true;
  }
  if (opened) controller_.quit();
  readable(10);
  return false;
}

bool Client::readable(int milliseconds) {
  pollfd watched[] = {{commands_.descriptor(), POLLIN, 0}, {controller_.getGSDescriptor(), POLLIN, 0}};
  ::poll(watched, 2, milliseconds);
  if (watched[0].revents && !commands_.read_some()) over_ = true;
  for (std::string line; commands_.next(&line);) obey(line);
  return watched[1].revents != 0;
}

void Client::serve() {
  const bool deaf = settings_.role == "deaf";
  for (auto& member : members_) {
    if (!deaf || env_.chance(60)) member->act();
  }
  bool gone = false;
  while (!over_ && !gone) {
    const bool early = readable(env_.upto(2 * kPause));
    if (deaf) continue;
    gone = controller_.dispatch(WYX_NON_BLOCKING) != WYX_OK;
    if (!early || env_.rally || env_.chance(2)) act_at_random();
  }
  env_.log(gone ? "X gone" : "X quit");
  controller_.quit();
}

void Client::act_at_random() {
  for (auto& watcher : watchers_) watcher->act();
  if (env_.rally) {
    for (auto& member : members_) member->act();
  } else if (!members_.empty()) {
    members_[static_cast<std::size_t>(env_.upto(kGroups - 1))]->act();
  }
}

void Client::obey(const std::string& line) {
  if (line == "quit") over_ = true;
  if (line == "rally") env_.rally = true;
  if (line == "fork") leave_behind();
  if (line != "report") return;
  for (auto& member : members_) std::printf("%s\n", member->report().c_str());
  for (auto& watcher : watchers_) std::printf("%s\n", watcher->report().c_str());
  std::printf(".\n");
  std::fflush(stdout);
}

void Client::leave_behind() {
  if (::fork() != 0) return;
  ::prctl(PR_SET_NAME, "storm-left");
  pollfd end{settings_.lifeline, POLLIN, 0};
  while (::poll(&end, 1, -1) < 0) {
  }
  ::_exit(0);
}

}  // namespace

int run_client(const ClientSettings& settings) { return Client(settings).run(); }

}  // namespace storm
