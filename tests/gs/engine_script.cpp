#include "gs/engine_script.h"

namespace gs::test {

SessionId Script::session(int who) const {
  auto it = nodes_.find(who);
  return {it == nodes_.end() ? 1 : it->second, static_cast<std::uint64_t>(who)};
}

void Script::apply(const Event& event) {
  last = engine.apply(event);
  model.follow(event, last, engine);
  log.insert(log.end(), last.deliveries.begin(), last.deliveries.end());
  timers.insert(timers.end(), last.timers.begin(), last.timers.end());
}

wyx_rc_t Script::request(int who, Request request, bool answered) {
  const wyx_rc_t expected = engine.precheck(session(who), request);
  apply(RequestEvent{session(who), std::move(request), answered});
  EXPECT_EQ(last.rc, expected) << "precheck and apply differ";
  return last.rc;
}

wyx_rc_t Script::join(int who, std::uint32_t node) {
  nodes_[who] = node;
  return request(who, JoinRequest{1, attributes, static_cast<std::int16_t>(who), "p" + std::to_string(who)});
}

void Script::group_of(std::initializer_list<int> members) {
  const GroupAttributes wanted = attributes;
  attributes.num_phases = WYX_1_PHASE;
  int first = 0;
  for (int who : members) {
    EXPECT_EQ(join(who), WYX_OK);
    if (first == 0) first = who;
  }
  if (wanted != attributes) {
    EXPECT_EQ(change_attributes(first, wanted), WYX_OK);
  }
  attributes = wanted;
  log.clear();
  timers.clear();
}

wyx_rc_t Script::change_state(int who, const Bytes& value, ProtocolTerms terms) {
  return request(who, StateChangeRequest{1, terms, value});
}
wyx_rc_t Script::send(int who, const Bytes& message, ProtocolTerms terms) {
  return request(who, MessageRequest{1, terms, message});
}
wyx_rc_t Script::leave(int who, std::uint32_t code, ProtocolTerms terms) {
  return request(who, LeaveRequest{1, terms, code});
}
wyx_rc_t Script::expel(int who, Membership listed, ProtocolTerms terms) {
  return request(who, ExpelRequest{1, terms, std::move(listed), 0, ""});
}
wyx_rc_t Script::change_attributes(int who, const GroupAttributes& to, ProtocolTerms terms) {
  return request(who, AttributeChangeRequest{1, terms, to});
}
wyx_rc_t Script::vote(int who, wyx_vote_value_t value, wyx_vote_value_t default_vote) {
  return request(who, VoteRequest{1, value, std::nullopt, std::nullopt, default_vote});
}
wyx_rc_t Script::vote_with(int who, wyx_vote_value_t value, std::optional<Bytes> state,
                           std::optional<Bytes> message) {
  return request(who, VoteRequest{1, value, std::move(state), std::move(message), WYX_NULL_VOTE});
}
void Script::vote_all(std::initializer_list<int> voters, wyx_vote_value_t value) {
  for (int who : voters) EXPECT_EQ(vote(who, value), WYX_OK) << "voter " << who;
}
wyx_rc_t Script::goodbye(int who) { return request(who, GoodbyeRequest{1}); }
wyx_rc_t Script::subscribe(int who, std::uint32_t control, const std::string& group) {
  return request(who, SubscribeRequest{kSubscriberToken, control, group});
}
wyx_rc_t Script::unsubscribe(int who) { return request(who, UnsubscribeRequest{kSubscriberToken}); }
void Script::dies(int who) { apply(SessionGoneEvent{session(who)}); }
void Script::expire(const TimerRequest& timer) { apply(TimerExpiredEvent{timer.id}); }

std::string Script::seen() {
  std::string all = text(log);
  log.clear();
  return all;
}

std::string Script::outcomes() {
  std::string all = seen(), short_lines;
  std::size_t begin = 0;
  while (begin < all.size()) {
    const std::size_t end = all.find('\n', begin);
    const std::string line = all.substr(begin, end - begin);
    short_lines += line.substr(0, line.find(", members")) + "\n";
    begin = end + 1;
  }
  return short_lines;
}

}  // namespace gs::test
