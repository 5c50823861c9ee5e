#include "storm/verdict.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <unordered_map>

#include "examples/processes.h"
#include "gscl/wyx_api.h"
#include "storm/board.h"

namespace storm {
namespace {

using Ids = std::vector<int>;

/// An event as one provider was told of it, or what a subscriber was told under its number.
struct Event {
  long seqnum = 0;
  char kind = 0;
  int protocol = 0;
  Ids members, changing;
  std::string state;
  bool updated = false;  // the state value
  std::string content;   // everything that must be the same at all
  const std::string* log = nullptr;

  bool ends() const { return kind != 'n'; }
};

/// A provider from its join on, or a subscriber from its subscription on.
struct Life {
  const std::string* log = nullptr;
  long self = 0;              // key of the provider; of a subscriber's group life: of any of its members
  int instance = 0;           // 0: a subscriber
  std::vector<Event> events;  // in the order of the log
  std::map<int, int> open;    // requests that nothing has come of yet, by protocol
  bool expelled = false;      // and not yet told that the group is dissolved
  bool over = false;
};

std::string name_of(const std::string& log) { return std::filesystem::path(log).filename(); }

[[noreturn]] void contradiction(const std::string& what, const std::string& log, const std::string& other = "") {
  throw zn::Failure{what + ", in " + name_of(log) + (other.empty() ? "" : " and " + name_of(other))};
}

/// The groups' lives: providers that were ever seen together belong to the same one.
class Kinships {
 public:
  long root(long key) {
    const auto [at, added] = parent_.try_emplace(key, key);
    if (at->second == key) return key;
    const long found = root(at->second);
    return parent_[key] = found;
  }
  void join(long a, long b) { parent_[root(a)] = root(b); }

 private:
  std::unordered_map<long, long> parent_;
};

Ids ids_of(const std::string& text) {
  Ids ids;
  if (text == "-") return ids;
  std::istringstream in(text);
  for (std::string id; std::getline(in, id, ',');) ids.push_back(std::stoi(id));
  return ids;
}

bool has(const Ids& ids, int id) { return std::find(ids.begin(), ids.end(), id) != ids.end(); }

class Judge {
 public:
  Judge(const std::vector<std::string>& logs, bool gaps) : logs_(logs), gaps_(gaps) {}

  Account run() {
    for (const std::string& log : logs_) read(log);
    agree();
    for (const auto& [root, of_group] : truth_) {
      follow(of_group);
      account_.events += of_group.size();
    }
    account_.logs = logs_.size();
    account_.group_lives = truth_.size();
    for (const Life& life : lives_) {
      if (life.instance != 0) check_sequence(life);
      if (life.instance == 0) check_subscriber(life);
    }
    return account_;
  }

 private:
  // Reading: what one log shows on its own is judged there.

  void read(const std::string& log) {
    log_ = &log;
    std::ifstream file(log);
    for (std::string line; std::getline(file, line) && !file.eof();) {  // a line without its end was cut by a kill
      std::istringstream in(line);
      char mark = 0;
      in >> mark;
      read_line(in, mark);
      if (in.fail()) contradiction("cannot read the line '" + line + "'", log);
    }
    current_.clear();
  }

  void read_line(std::istringstream& in, char mark) {
    if (mark == 'S') {
      in >> life_;
      return current_.clear();
    }
    if (mark == 'X') {
      std::string how;
      in >> how;
      return end_session(how == "gone");
    }
    if (mark == 'E') return read_event(in);
    int group = 0, instance = 0, what = 0;
    in >> group >> instance;
    if (mark == 'J' || mark == 'B') {
      const int id = mark == 'J' ? instance : -instance;
      current_[{group, id}] = lives_.size();
      lives_.push_back({log_, mark == 'J' ? key(group, id) : 0, mark == 'J' ? id : 0, {}, {}, false, false});
      account_.requests++;
      if (mark == 'J') lives_.back().open[WYX_JOIN]++;
      return;
    }
    if (mark == 'T') return read_subscription(in, group, instance);
    Life& life = provider(group, instance);
    if (mark == 'G') {
      life.over = true;
      return;
    }
    in >> what;
    if (mark == 'R') {
      account_.requests++;
      life.open[what]++;
    } else if (mark == 'D') {
      if (life.open[what]-- == 0) contradiction("a delayed error for no request", *log_);
      if (what == WYX_JOIN) life.over = true;
    } else if (what == WYX_GROUP_DISSOLVED) {
      if (!life.expelled) contradiction("dissolved for a provider that was not expelled", *log_);
      settle_requests(life, {}, 0);
      life.over = true;
    } else {
      life.over = true;  // the daemon is gone
    }
  }

  void read_event(std::istringstream& in) {
    int group = 0, instance = 0, by = 0;
    Event event;
    in >> group >> instance >> by >> std::ws;
    std::getline(in, event.content);
    std::istringstream parts(event.content);
    std::string members, changing;
    parts >> event.seqnum >> event.kind >> event.protocol >> members >> changing >> event.state >> event.updated;
    if (parts.fail()) return in.setstate(std::ios::failbit);
    in.clear();
    event.members = ids_of(members);
    event.changing = ids_of(changing);
    event.log = log_;
    Life& life = provider(group, instance);
    relate(life.self, group, event);
    settle_requests(life, event, by);
    life.events.push_back(std::move(event));
  }

  void read_subscription(std::istringstream& in, int group, int serial) {
    Event event;
    std::string members, changing;
    int type = 0;
    in >> event.seqnum >> type >> members >> changing >> event.state;
    event.members = ids_of(members);
    event.changing = ids_of(changing);
    event.log = log_;
    account_.subscriptions++;
    const std::size_t at = current_.at({group, -serial});
    Life& life = lives_[at];
    if (type == WYX_SUBSCRIPTION_DISSOLVED || type == WYX_SUBSCRIPTION_GS_HAS_DIED) return;
    if ((type & WYX_SUBSCRIPTION_MEMBERSHIP) == 0) event.protocol = WYX_STATE_VALUE_CHANGE;  // members: unchanged
    if (life.self == 0 && event.members.empty()) contradiction("a first notification without members", *log_);
    if (life.self == 0) life.self = key(group, event.members.front());
    relate(life.self, group, event);
    const bool ends = (type & WYX_SUBSCRIPTION_PERSISTENT) != 0;
    if (ends) event.state = "-";
    life.events.push_back(std::move(event));
    if (!ends) return;
    current_[{group, -serial}] = lives_.size();  // the next life of the group is another one's
    lives_.push_back({log_, 0, 0, {}, {}, false, false});
  }

  /// What an event means for the requests of a provider that is told of it; an empty one: it is told nothing more.
  void settle_requests(Life& life, const Event& event, int by) {
    const bool about_self = has(event.changing, life.instance);
    const bool each_its_own = event.protocol == WYX_JOIN || event.protocol == WYX_LEAVE;
    if (event.ends() && (each_its_own ? about_self : by == life.instance)) life.open[event.protocol] = 0;
    const bool out = about_self && ((event.kind == 'r' && event.protocol == WYX_JOIN) ||
                                    (event.kind == 'a' && event.protocol != WYX_JOIN));
    life.expelled |= out && event.protocol == WYX_EXPEL;
    if (event.kind != 0 && (!out || life.expelled)) return;
    for (const auto& [protocol, count] : life.open) {
      if (count > 0) contradiction("nothing came of a request, protocol " + std::to_string(protocol), *life.log);
    }
    life.over = true;
  }

  void end_session(bool told) {
    for (const auto& [id, at] : current_) {
      const Life& life = lives_[at];
      if (told && life.instance != 0 && !life.over) {
        contradiction("provider " + std::to_string(life.instance) + " of group " + std::to_string(id.first) +
                          " was not told of the end of group services",
                      *life.log);
      }
    }
    current_.clear();
  }
  long key(int group, int instance) const { return (life_ * kGroups + group) * 65536L + instance; }

  Life& provider(int group, int instance) {
    const auto found = current_.find({group, instance});
    if (found == current_.end()) contradiction("something for a provider that never joined", *log_);
    Life& life = lives_[found->second];
    if (life.over) {
      contradiction("something for provider " + std::to_string(instance) + " of group " + std::to_string(group) +
                        ", which is out",
                    *log_);
    }
    return life;
  }

  void relate(long with, int group, const Event& event) {
    for (const Ids* ids : {&event.members, &event.changing}) {
      for (int id : *ids) kin_.join(with, key(group, id));
    }
  }

  // Comparing

  /// All who saw an event of a group's life saw the same.
  void agree() {
    for (const Life& life : lives_) {
      if (life.instance == 0) continue;
      auto& of_group = truth_[kin_.root(life.self)];
      for (const Event& event : life.events) {
        account_.notifications++;
        const auto [at, first] = of_group.try_emplace(event.seqnum, event);
        if (!first && at->second.content != event.content) {
          contradiction("not the same event: '" + at->second.content + "' and '" + event.content + "'",
                        *at->second.log, *event.log);
        }
      }
    }
  }

  /// Each event's membership and state follow from the event before.
  void follow(const std::map<long, Event>& of_group) const {
    const Event none{0, 'r', 0, {}, {}, "", true, "", nullptr};
    const Event* before = &none;
    for (const auto& [seqnum, event] : of_group) {
      const bool known = seqnum == before->seqnum + 1;  // else nobody lives who was told of those between
      Ids expected = before->members;
      if (event.kind == 'a' && event.protocol == WYX_JOIN) {
        expected.insert(expected.end(), event.changing.begin(), event.changing.end());
      } else if (event.kind == 'a') {
        std::erase_if(expected, [&gone = event.changing](int id) { return has(gone, id); });
      }
      if (known && expected != event.members) contradiction("wrong members: " + event.content, *event.log);
      if (known && !event.updated && before != &none && event.state != before->state) {
        contradiction("the state has changed without being changed: " + event.content, *event.log);
      }
      before = &event;
    }
  }

  /// No gap, no repetition: but nobody is asked about its own leave or expel.
  void check_sequence(const Life& life) {
    const auto& truth = group_of(life.self);
    long last = 0;
    for (const Event& event : life.events) {
      const bool about_self = has(event.changing, life.instance);
      if (last == 0 && (event.protocol != WYX_JOIN || !about_self)) {
        contradiction("does not begin with its join: " + event.content, *life.log);
      }
      const bool may_skip =
          event.ends() && (event.protocol == WYX_LEAVE || event.protocol == WYX_EXPEL) && about_self;
      const bool follows = event.seqnum == last + 1 || (event.seqnum > last && (may_skip || gaps_));
      if (last != 0 && !follows) {
        contradiction(std::to_string(event.seqnum) + " came after " + std::to_string(last) + ": " + event.content,
                      *life.log);
      }
      for (auto at = truth.upper_bound(last); last != 0 && at != truth.end() && at->first < event.seqnum; ++at) {
        const Event& missed = at->second;
        if (may_skip && missed.kind == 'n' && missed.protocol == event.protocol) continue;
        contradiction("was not told of '" + missed.content + "'", *life.log, *missed.log);
      }
      last = event.seqnum;
    }
  }

  /// A subscriber is told of each change of members and state, with the members' numbers.
  void check_subscriber(const Life& life) {
    if (life.events.empty()) return;
    const auto& truth = group_of(life.self);
    long last = 0;
    for (const Event& told : life.events) {
      if (told.seqnum <= last) contradiction("a subscriber's numbers go back", *life.log);
      for (auto at = truth.upper_bound(last); last != 0 && at != truth.end() && at->first < told.seqnum; ++at) {
        const Event& e = at->second;
        if (e.kind == 'a' && (!e.changing.empty() || e.updated)) {
          contradiction("a subscriber was not told of '" + e.content + "'", *life.log, *e.log);
        }
      }
      last = told.seqnum;
      const auto seen = truth.find(told.seqnum);
      if (seen == truth.end()) continue;
      const bool same = (told.protocol == WYX_STATE_VALUE_CHANGE || told.members == seen->second.members) &&
                        (told.state == "-" || told.state == seen->second.state);
      if (!same)
        contradiction("a subscriber was told something else than '" + seen->second.content + "'", *life.log,
                      *seen->second.log);
    }
  }
  const std::map<long, Event>& group_of(long member) { return truth_[kin_.root(member)]; }

  const std::vector<std::string>& logs_;
  const bool gaps_;
  std::vector<Life> lives_;
  std::map<std::pair<int, int>, std::size_t> current_;  // (group, instance or -serial) of this log's session
  const std::string* log_ = nullptr;
  int life_ = 0;  // of the daemon
  Kinships kin_;
  std::map<long, std::map<long, Event>> truth_;  // by group life and number
  Account account_;
};

}  // namespace

Account judge(const std::vector<std::string>& logs, bool gaps) { return Judge(logs, gaps).run(); }

}  // namespace storm
