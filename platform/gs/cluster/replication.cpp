#include "cluster/replication.h"

#include <algorithm>
#include <iterator>
#include <utility>

namespace gs::cluster {
namespace {

/// A daemon speaks for its own clients and adapters, and of hosts nobody speaks: they come and go by the
/// decisions.
bool may_order(Node from, const Event& event) {
  if (const auto* request = std::get_if<RequestEvent>(&event)) return request->session.node == from;
  if (const auto* gone = std::get_if<SessionGoneEvent>(&event)) return gone->session.node == from;
  if (const auto* ping = std::get_if<ResponsivenessEvent>(&event)) return ping->session.node == from;
  if (const auto* adapters = std::get_if<AdaptersEvent>(&event)) return adapters->node == from;
  return std::holds_alternative<TimerExpiredEvent>(event) || std::holds_alternative<ContinueEvent>(event);
}

}  // namespace

Replication::Replication(const Settings& settings, Order& order, Replica& replica, Host& host,
                         std::function<std::uint64_t()> random, std::function<std::uint64_t()> clock)
    : settings_(settings),
      order_(order),
      replica_(replica),
      host_(host),
      random_(std::move(random)),
      clock_(std::move(clock)),
      life_(random_()) {}

const char* Replication::state() const {
  switch (state_) {
    case State::kOut:
      return verdict_ && !verdict_->quorate ? "out: no quorum" : "out";
    case State::kWaiting:
      return "waiting for quorum or for others";
    case State::kExchange:
      return "exchanging histories";
    case State::kRunning:
      return catching_up_ ? "catching up" : serves_ ? "serving" : "waiting for confirmations";
  }
  return "";
}

// ------------------------------------------------------------------------------------- views, rings and verdicts

void Replication::view_changed(const View& view) {
  if (state_ == State::kOut) {
    if (!joining_ || std::ranges::find(view.joined, settings_.self) == view.joined.end()) return;
    joining_ = false;
  } else if (std::ranges::find(view.members, settings_.self) == view.members.end()) {
    return lose("it is out of the process group");
  }
  view_ = view.members;
  std::ranges::sort(view_);
  std::erase_if(evicted_, [this](const Process& p) { return !std::ranges::binary_search(view_, p); });
  for (const auto& [process, code] : view.left) left_[process.node] = code;
  stop();
}

void Replication::ring_changed(const RingId& ring) {
  if (ring == ring_) return;
  ring_ = ring;
  evicted_.clear();
  if (state_ == State::kOut || !keeps(Rule::kEveryRing)) return;
  stop();
}

void Replication::verdict(const Verdict& verdict) {
  if (verdict_ && verdict.ring.sequence < verdict_->ring.sequence) return;
  verdict_ = verdict;
  if (!verdict.quorate && joining_) {
    order_.leave();
    joining_ = false;
  }
  if (state_ == State::kOut) {
    if (!verdict.quorate) replica_.wait_no_more();
    return join_if_quorate();
  }
  if (has_lost_quorum()) return lose("this host has no quorum");
  begin_if_lowest();
  answer_begin();
  apply_confirmed();
}

/// In a ring that a later one has passed over, what this daemon says would come too late.
bool Replication::goes_on() const {
  return !keeps(Rule::kVerdictFirst) || (verdict_ && verdict_->quorate && verdict_->ring == ring_);
}

bool Replication::has_lost_quorum() const {
  return verdict_ && !verdict_->quorate && verdict_->ring.sequence >= ring_.sequence;
}

void Replication::stop() {
  state_ = State::kWaiting;
  exchange_.reset();
  catching_up_.reset();
  donation_.reset();
  begun_ = false;
  progress();
  if (has_lost_quorum()) return lose("this host has no quorum");
  begin_if_lowest();
}

void Replication::join_if_quorate() {
  if (state_ != State::kOut || joining_ || !verdict_ || !verdict_->quorate || now_ < join_from_) return;
  joining_ = true;
  order_.join();
}

void Replication::gone(const std::string& why) {
  verdict_.reset();
  joining_ = false;
  if (state_ == State::kOut) return replica_.wait_no_more();
  lose(why);
}

void Replication::lose(const std::string& why) {
  if (state_ == State::kOut) return;
  state_ = State::kOut;
  serves_ = aside_ = begun_ = answered_ = false;
  life_ = random_();
  begins_ = sent_ = told_ = 0;
  view_.clear();
  evicted_.clear();
  left_.clear();
  exchange_.reset();
  catching_up_.reset();
  donation_.reset();
  decision_.reset();
  confirmations_.clear();
  own_ = {};
  order_.leave();
  join_from_ = now_ + pause_;
  pause_ = std::min(2 * pause_, kLongestPause);
  replica_.reset(why);
}

// ----------------------------------------------------------------------------------------------------- exchanges

/// Two who hold each other up may have had all evicted: then nobody is.
std::vector<Process> Replication::not_evicted() const {
  std::vector<Process> rest;
  std::ranges::copy_if(view_, std::back_inserter(rest),
                       [this](const Process& p) { return !evicted_.contains(p); });
  return rest.empty() ? view_ : rest;
}

void Replication::begin_if_lowest() {
  if (state_ != State::kWaiting || begun_ || !goes_on()) return;
  const auto rest = not_evicted();
  if (rest.front() == settings_.self) order_begin(rest);
}

void Replication::order_begin(std::vector<Process> asked) {
  begun_ = true;
  Begin begin;
  begin.id = {life_, ++begins_};
  begin.ring = ring_;
  begin.votes = verdict_->votes;
  const bool all = asked.size() == view_.size();
  begin.needed = all || !keeps(Rule::kVotesOfHolders) ? 0 : verdict_->needed;
  begin.asked = std::move(asked);
  begin.clock = clock_();
  order_.send(begin);
}

void Replication::received(const Process& from, const Message& message) {
  if (state_ == State::kOut) return;
  std::visit([&](const auto& m) { on(from, m); }, message);
}

void Replication::on(const Process&, const Begin& begin) {
  if (begin.ring != ring_) return;
  state_ = State::kExchange;
  exchange_.emplace(begin);
  catching_up_.reset();
  donation_.reset();
  confirmations_.clear();
  answered_ = false;
  progress();
  for (const Process& asked : begin.asked) evicted_.erase(asked);
  history_at_begin_ = own_.history;
  answer_begin();
}

/// Who is not asked asks everybody: an exchange that ends before goes on without it.
void Replication::answer_begin() {
  if (state_ != State::kExchange || answered_ || !goes_on()) return;
  answered_ = true;
  if (!exchange_->asks(settings_.self)) {
    if (keeps(Rule::kEvictedBeginsAgain)) order_begin(view_);
    return;
  }
  Word word;
  word.begin = exchange_->begin().id;
  word.life = life_;
  word.history = history_at_begin_;
  if (word.history && !keeps(Rule::kHistoryOfRing)) word.history->ring = 0;
  if (word.history && !keeps(Rule::kHistoryOfExchanges)) word.history->exchanges = 0;
  if (word.history && !keeps(Rule::kHistoryOfMessages)) word.history->messages = 0;
  word.limits = settings_.limits;
  word.left = left_;
  word.address = order_.address();
  word.key = order_.key();
  order_.send(word);
}

void Replication::on(const Process& from, const Word& word) {
  if (state_ != State::kExchange) return;
  Word taken = word;
  if (!keeps(Rule::kWordNamesBegin)) taken.begin = exchange_->begin().id;
  if (!exchange_->add(from.node, taken)) return;
  order_.set_peers(exchange_->words());
  progress();
  conclude();
}

void Replication::conclude() {
  const auto decision = exchange_->decision();
  if (!decision) return;
  if (!exchange_->asks(settings_.self)) {
    if (keeps(Rule::kEvictedIsToldToLose)) lose("the others went on without it: it did not answer in time");
    return;
  }
  if (!fits(*decision)) return;
  state_ = State::kRunning;
  decision_ = decision;
  if (has(decision->holders, settings_.self.node, life_))
    become_holder(decision);
  else
    catch_up(decision);
  confirmations_[settings_.self.node] = 1;
  told_ = 0;
  left_.clear();
  apply_confirmed();
}

/// A daemon that speaks another version than those who have the state, or has other limits, cannot be among them.
bool Replication::fits(const Decision& decision) const {
  const auto& [node, life] = *decision.holders.begin();
  const Word& word = exchange_->words().at(node);
  const std::string holder = "the daemon of node " + std::to_string(node);
  if (word.version != kProtocolVersion) {
    host_.give_up(holder + " speaks protocol version " + std::to_string(word.version) + ", not " +
                  std::to_string(kProtocolVersion) + ": run the same release on all hosts");
    return false;
  }
  if (word.limits == settings_.limits) return true;
  host_.give_up(holder +
                " has another delivery, state-bound, session-state-bound, user-state-bound or "
                "max-phase-time: set the same on all hosts");
  return false;
}

void Replication::become_holder(const std::shared_ptr<const Decision>& decision) {
  aside_ = false;
  own_.append(decision);
}

/// Its own state is kept until it has the others': they may be gone before.
void Replication::catch_up(const std::shared_ptr<const Decision>& decision) {
  aside_ = true;
  if (!keeps(Rule::kAside)) own_ = {};
  catching_up_.emplace();
  catching_up_->track.append(decision);
  if (!std::exchange(serves_, false)) return;
  life_ = random_();
  begins_ = sent_ = 0;
  replica_.drop_clients("other hosts have gone on without this one");
}

// --------------------------------------------------------------------------------------- receiving and applying

void Replication::submit(Event event) {
  if (serves_) order_.send(Ordered{life_, ++sent_, std::make_shared<const Event>(std::move(event))});
}

void Replication::on(const Process& from, const Ordered& ordered) {
  Track& track = current();
  if (!catching_up_ && aside_) return;
  if (!track.history || (keeps(Rule::kLives) && !has(track.lives, from.node, ordered.life))) return;
  if (!may_order(from.node, *ordered.event)) return;
  if (track.waiting.empty()) progress();
  track.append(ordered, ring_);
  if (state_ != State::kRunning) return;
  confirmations_[settings_.self.node] = track.received;
  if (!settings_.safe) apply_confirmed();
}

void Replication::settle() {
  if (state_ != State::kRunning) return;
  apply_confirmed();
  if (state_ != State::kRunning || told_ == current().received) return;
  const bool awaited = settings_.safe || told_ == 0;  // else only the decision is
  told_ = current().received;
  if (awaited) order_.confirm({exchange_->begin().id, told_, {}});
}

void Replication::confirmed(Node from, const Confirmed& confirmed) {
  if (!exchange_) return;
  if (keeps(Rule::kConfirmNamesExchange) && confirmed.begin != exchange_->begin().id) return;
  std::uint64_t& known = confirmations_[from];
  known = std::max(known, confirmed.position);
  apply_confirmed();
}

std::uint64_t Replication::confirmed_by_all() const {
  std::uint64_t position = current().received;
  for (const auto& [node, life] : decision_->asked) {
    const auto found = confirmations_.find(node);
    position = std::min(position, found == confirmations_.end() ? 0 : found->second);
  }
  if (!keeps(Rule::kConfirmAll)) return current().received;
  if (!keeps(Rule::kConfirmDecision)) return std::max<std::uint64_t>(position, 1);
  return settings_.safe || position == 0 ? position : current().received;
}

void Replication::apply_confirmed() {
  if (state_ != State::kRunning || catching_up_ || !goes_on()) return;
  const std::uint64_t position = confirmed_by_all();
  while (state_ == State::kRunning && !own_.waiting.empty() && own_.waiting.front().position <= position) {
    const Entry entry = own_.take();
    progress();
    if (const auto* event = std::get_if<std::shared_ptr<const Event>>(&entry.what))
      replica_.apply(**event);
    else
      apply(*std::get<std::shared_ptr<const Decision>>(entry.what));
  }
}

/// Who is there is what the engine knows: whose life does not go on has failed, whatever came before. The lowest
/// goes last, so that none becomes the master that goes as well.
void Replication::apply(const Decision& decision) {
  const Lives before = std::exchange(own_.hosts, decision.holders);
  const auto apply = [this](const Event& event) {
    if (state_ == State::kRunning) replica_.apply(event);  // else it has failed with the one before
  };
  const auto goes_on = [&](const auto& host) { return has(decision.holders, host.first, host.second); };
  const bool somebody_gone = before.empty() || !std::ranges::all_of(before, goes_on);
  if (somebody_gone && keeps(Rule::kNumbersGoOn)) apply(NumbersEvent{decision.numbers});
  for (auto host = before.rbegin(); host != before.rend(); ++host) {
    if (goes_on(*host) || (!keeps(Rule::kHostsAreState) && !decision.left.contains(host->first))) continue;
    const auto code = decision.left.find(host->first);
    apply(
        HostGoneEvent{host->first, code == decision.left.end() ? std::uint32_t{WYX_HOST_FAILURE} : code->second});
  }
  for (const auto& [node, life] : decision.holders) {
    if (!has(before, node, life)) apply(HostCameEvent{node});
  }
  if (state_ != State::kRunning || decision.begin != decision_->begin) return;
  serve(decision);
  if (state_ == State::kRunning) donate(decision);
}

void Replication::serve(const Decision& decision) {
  Domain domain;
  domain.self = settings_.self.node;
  domain.sessions_above = 1000 * clock_();  // fewer begin in a life than it has microseconds
  for (const auto& [node, life] : decision.holders) {
    if (node < settings_.self.node) ++domain.rank;
    domain.nodes.push_back(node);
  }
  serves_ = true;
  pause_ = kFirstPause;
  replica_.serve(domain);
}

// ------------------------------------------------------------------------------------------ state for newcomers

void Replication::donate(const Decision& decision) {
  const bool lowest = decision.holders.begin()->first == settings_.self.node;
  if (!lowest || decision.holders.size() == decision.asked.size()) return;
  donation_ = Donation{replica_.snapshot()};
  if (donation_->state.empty()) {
    host_.log("the state is over 1.5 GiB and cannot be sent: set a lower state-bound on all hosts");
    order_.send(Piece{0, 1, {}});
    return donation_.reset();
  }
  donation_->count = static_cast<std::uint32_t>((donation_->state.size() + settings_.piece - 1) / settings_.piece);
  for (std::size_t i = 0; i < kPiecesUnderWay; ++i) send_piece();
}

void Replication::send_piece() {
  if (donation_->sent == donation_->count) return;
  const std::uint64_t from = std::uint64_t{donation_->sent} * settings_.piece;
  order_.send(Piece{donation_->sent++, donation_->count, donation_->state.part(from, settings_.piece)});
}

void Replication::on(const Process& from, const Piece& piece) {
  if (donation_ && from == settings_.self) return send_piece();
  if (!catching_up_ || from.node != decision_->holders.begin()->first || piece.index != catching_up_->next) return;
  ++catching_up_->next;
  if (!catching_up_->state.add(piece.bytes)) return lose("the state that " + name_of(from) + " sends is none");
  progress();
  if (catching_up_->next == piece.count) take_state(from);
}

void Replication::take_state(const Process& from) {
  std::string error = "it is cut off";
  if (!catching_up_->state.complete() || !replica_.restore(catching_up_->state.take(), &error))
    return lose("the state that " + name_of(from) + " sent does not fit: " + error);
  own_ = std::move(catching_up_->track);
  own_.hosts = decision_->holders;
  own_.take();  // the decision: the state is what it led to
  catching_up_.reset();
  aside_ = false;
  apply_confirmed();
  if (state_ != State::kRunning) return;
  if (keeps(Rule::kBeginWhenCaughtUp)) return order_begin(not_evicted());
  serve(*decision_);
}

// ------------------------------------------------------------------------------------------------ time and limits

void Replication::on(const Process& from, const Confirmed& confirmed) {
  this->confirmed(from.node, confirmed);
  if (state_ == State::kRunning && std::ranges::find(confirmed.ask, settings_.self.node) != confirmed.ask.end())
    confirm_in_order({});
}

void Replication::confirm_in_order(std::vector<Node> ask) {
  told_ = current().received;
  order_.send(Confirmed{exchange_->begin().id, told_, std::move(ask)});
}

/// The way beside the order may be shut.
void Replication::ask_again() {
  repeated_ = now_;
  auto ask = unconfirmed();
  if (!ask.empty()) confirm_in_order(std::move(ask));
}

std::vector<Node> Replication::unconfirmed() const {
  std::vector<Node> nodes;
  const std::uint64_t wanted = current().waiting.empty() ? 0 : current().waiting.front().position;
  for (const auto& [node, life] : decision_->asked) {
    const auto found = confirmations_.find(node);
    if ((found == confirmations_.end() ? 0 : found->second) < wanted) nodes.push_back(node);
  }
  return nodes;
}

std::vector<Process> Replication::who_holds_up() const {
  if (!goes_on()) return {};
  const auto rest = not_evicted();
  if (state_ == State::kWaiting) return {rest.front()};
  if (state_ == State::kExchange) return exchange_->missing();
  if (state_ != State::kRunning) return {};
  auto nodes = unconfirmed();
  if (nodes.empty() && catching_up_) nodes.push_back(decision_->holders.begin()->first);
  std::vector<Process> holders_up;
  std::ranges::copy_if(rest, std::back_inserter(holders_up), [&](const Process& process) {
    return std::ranges::find(nodes, process.node) != nodes.end();
  });
  return holders_up;
}

/// The lowest of the others does, and each next one a while later: it may be gone.
void Replication::evict_who_holds_up() {
  const auto who = who_holds_up();
  if (who.empty() || std::ranges::find(who, settings_.self) != who.end()) return;
  Duration rank{0};
  for (const Process& process : not_evicted()) {
    if (process == settings_.self) break;
    if (std::ranges::find(who, process) == who.end()) rank += kBetweenRanks;
  }
  if (now_ < progressed_ + settings_.member_timeout + rank) return;
  progress();
  for (const Process& process : who) host_.log(name_of(process) + " does not answer and is left out");
  order_.send(Evict{ring_, who});
}

void Replication::on(const Process&, const Evict& evict) {
  if (evict.ring != ring_) return;
  std::ranges::copy_if(evict.who, std::inserter(evicted_, evicted_.end()),
                       [this](const Process& process) { return std::ranges::binary_search(view_, process); });
  stop();
}

bool Replication::waits_for_others() const {
  return state_ == State::kRunning ? catching_up_ || !own_.waiting.empty() : state_ != State::kOut;
}

std::optional<Time> Replication::next_deadline() const {
  if (state_ == State::kOut) {
    const bool wants_in = verdict_ && verdict_->quorate && !joining_;
    return wants_in ? std::optional(join_from_) : std::nullopt;
  }
  if (!waits_for_others()) return std::nullopt;
  const Time evict = std::max(progressed_ + settings_.member_timeout, now_ + kBetweenRanks);
  return state_ == State::kRunning ? std::min(evict, std::max(progressed_, repeated_) + kRepeat) : evict;
}

void Replication::advance(Time now) {
  now_ = now;
  if (state_ == State::kOut) return join_if_quorate();
  if (!waits_for_others()) return;
  if (state_ == State::kRunning && now >= std::max(progressed_, repeated_) + kRepeat) ask_again();
  evict_who_holds_up();
}

}  // namespace gs::cluster
