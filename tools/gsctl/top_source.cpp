#include "tools/gsctl/top_source.h"

#include <utility>

namespace gsctl {
namespace {

constexpr auto kPatience = std::chrono::seconds(1);  // of connecting

template <typename T>
void append(std::vector<T>& to, std::vector<T> more) {
  std::move(more.begin(), more.end(), std::back_inserter(to));
}

inspect::AskT question(inspect::What what) {
  inspect::AskT ask;
  ask.what = what;
  return ask;
}

}  // namespace

TopSource::TopSource(Loop& loop, double interval, Callbacks callbacks)
    : loop_(loop), interval_(interval), callbacks_(std::move(callbacks)) {
  connect();
  begin();
}

void TopSource::connect() {
  inspector_.emplace(daemon_path(), kPatience);
  readable_ = loop_.on_readable(inspector_->fd(), [this] { receive(); });
}

void TopSource::begin() {
  const Wanted wanted = callbacks_.wanted();
  snapshot_ = {};
  asks_ = {};
  asks_.push_back(question(inspect::What::Daemon));
  asks_.push_back(question(inspect::What::Groups));
  asks_.back().brief = true;
  if (wanted.sessions) asks_.push_back(question(inspect::What::Sessions));
  if (!wanted.members_of.empty()) {
    asks_.push_back(question(inspect::What::Members));
    asks_.back().groups = {wanted.members_of};
  }
  ask_next();
}

void TopSource::ask_now() {
  if (inspector_ && asks_.empty()) try_again();
}

void TopSource::ask_next() {
  if (asks_.empty()) {
    callbacks_.told(std::exchange(snapshot_, {}));
    return again();
  }
  inspector_->send(asks_.front());
}

void TopSource::receive() {
  try {
    while (auto report = inspector_->next()) take(std::move(*report));
  } catch (const gs::inspect::InspectError& error) {
    lose(error.what());
  }
}

void TopSource::take(inspect::ReportT report) {
  if (asks_.empty()) return;
  if (report.daemon) snapshot_.daemon = std::move(*report.daemon);
  append(snapshot_.groups, std::move(report.groups));
  append(snapshot_.sessions, std::move(report.sessions));
  append(snapshot_.members, std::move(report.members));
  inspect::AskT& ask = asks_.front();
  const bool goes_on = report.next > ask.from || report.next_group > ask.after;
  if (report.more && goes_on) {
    ask.from = report.next;
    ask.after = report.next_group;
  } else {
    asks_.pop_front();
  }
  ask_next();
}

void TopSource::lose(const std::string& why) {
  readable_.reset();
  inspector_.reset();
  asks_.clear();
  callbacks_.lost(why);
  again();
}

void TopSource::again() {
  time_ = loop_.after(std::chrono::duration<double>(interval_), [this] { try_again(); });
}

void TopSource::try_again() {
  try {
    if (!inspector_) connect();
    begin();
  } catch (const gs::inspect::InspectError& error) {
    lose(error.what());
  }
}

}  // namespace gsctl
