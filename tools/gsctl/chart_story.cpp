#include "tools/gsctl/chart_story.h"

#include <algorithm>
#include <set>

#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

using inspect::HappeningT;
using inspect::Kind;

Mark::Shape shape_of_vote(const std::string& vote) {
  if (vote == "reject") return Mark::Shape::kReject;
  return vote == "continue" ? Mark::Shape::kContinue : Mark::Shape::kApprove;
}

class Teller {
 public:
  Teller(const Recording& recording, const std::string& group);
  void tell(const HappeningT& h);
  Story finish(Microseconds end);

 private:
  std::size_t lane(const inspect::Id& id, const std::string& name);
  std::string name_of(std::size_t lane) const;
  void begin_stay(std::size_t lane, Microseconds time, bool member);
  void end_stay(std::size_t lane, Microseconds time);
  bool stays(std::size_t lane) const { return open_[lane].has_value(); }

  Protocol& running(const HappeningT& h);
  void request(const HappeningT& h);
  void phase(const HappeningT& h);
  void vote(const HappeningT& h);
  void end(const HappeningT& h, Protocol::End how);
  void close_phase(Protocol& protocol, Microseconds time);
  void note(const HappeningT& h, Mark::Shape shape, const std::string& label);

  Story story_;
  std::vector<std::optional<Stay>> open_;  // of each lane
  bool runs_ = false;                      // the last protocol
};

Teller::Teller(const Recording& recording, const std::string& group) {
  story_.group = group;
  const auto known = recording.groups.find(group);
  if (known == recording.groups.end()) return;
  for (const KnownMember& member : known->second) {
    begin_stay(lane(member.id, member.name), recording.started_us, true);
  }
}

std::size_t Teller::lane(const inspect::Id& id, const std::string& name) {
  const auto found =
      std::find_if(story_.lanes.begin(), story_.lanes.end(), [&](const Lane& lane) { return same(lane.id, id); });
  const auto index = static_cast<std::size_t>(found - story_.lanes.begin());
  if (found == story_.lanes.end()) {
    story_.lanes.push_back({id, name, {}, {}});
    open_.emplace_back();
  }
  if (!name.empty()) story_.lanes[index].name = name;
  return index;
}

std::string Teller::name_of(std::size_t index) const {
  const Lane& lane = story_.lanes[index];
  return lane.name.empty() ? to_text(provider_of(lane.id)) : lane.name;
}

void Teller::begin_stay(std::size_t index, Microseconds time, bool member) {
  if (open_[index] && open_[index]->member == member) return;
  end_stay(index, time);
  open_[index] = Stay{time, time, member};
}

void Teller::end_stay(std::size_t index, Microseconds time) {
  if (!open_[index]) return;
  open_[index]->to = time;
  story_.lanes[index].stays.push_back(*open_[index]);
  open_[index].reset();
}

void Teller::note(const HappeningT& h, Mark::Shape shape, const std::string& label) {
  auto& marks = h.who ? story_.lanes[lane(*h.who, h.name)].marks : story_.marks;
  marks.push_back({shape, h.time_us, label});
}

/// The protocol that this belongs to; where the recording began in the middle of it, it is known from here on.
Protocol& Teller::running(const HappeningT& h) {
  if (!runs_ || story_.protocols.back().number != h.number) {
    Protocol& protocol = story_.protocols.emplace_back();
    protocol.kind = h.protocol;
    protocol.number = h.number;
    protocol.from = h.time_us;
    runs_ = true;
  }
  return story_.protocols.back();
}

void Teller::request(const HappeningT& h) {
  if (h.protocol == "vote" || !h.who) return;  // the vote itself is told too
  const bool refused = h.what != "WYX_OK";
  const std::size_t asker = lane(*h.who, h.name);
  if (h.protocol == "join" && !refused) begin_stay(asker, h.time_us, false);
  const std::string label = refused ? h.protocol + ": " + h.what : "asks: " + h.protocol;
  note(h, refused ? Mark::Shape::kRefused : Mark::Shape::kRequest, label);
}

void Teller::close_phase(Protocol& protocol, Microseconds time) {
  if (protocol.phases.empty()) return;
  Phase& phase = protocol.phases.back();
  phase.to = time;
}

void Teller::phase(const HappeningT& h) {
  Protocol& protocol = running(h);
  close_phase(protocol, h.time_us);
  protocol.phases.push_back({h.phase, h.time_us, h.time_us, {}});
}

void Teller::vote(const HappeningT& h) {
  if (!h.who) return;
  Protocol& protocol = running(h);
  if (protocol.phases.empty()) protocol.phases.push_back({h.phase, protocol.from, h.time_us, {}});
  const bool is_default = h.kind == Kind::DefaultVote;
  Phase& phase = protocol.phases.back();
  phase.waits.push_back({lane(*h.who, h.name), phase.from, h.time_us, !is_default, is_default ? h.what : ""});
  const std::string message = h.message.empty() ? "" : " " + gsctl::quoted(h.message);
  note(h, is_default ? Mark::Shape::kDefault : shape_of_vote(h.what),
       (is_default ? "default: " + h.what : h.what) + message);
}

void Teller::end(const HappeningT& h, Protocol::End how) {
  Protocol& protocol = running(h);
  if (!h.changing.empty()) protocol.changing = h.changing;
  if (protocol.changing.empty() && h.who) protocol.changing = {*h.who};
  close_phase(protocol, h.time_us);
  protocol.to = h.time_us;
  protocol.end = how;
  protocol.event_number = h.event_number;
  runs_ = false;
  const bool approved = how == Protocol::End::kApproved;
  for (const inspect::Id& id : protocol.changing) {
    if (protocol.kind == "join" && approved) begin_stay(lane(id, ""), h.time_us, true);
    if (protocol.kind == "join" ? !approved : approved && is_departure(protocol.kind)) {
      end_stay(lane(id, ""), h.time_us);
    }
  }
}

void Teller::tell(const HappeningT& h) {
  switch (h.kind) {
    case Kind::Request:
      return request(h);
    case Kind::Begin: {
      Protocol& protocol = running(h);
      protocol.changing = h.changing;
      if (h.who) protocol.by = name_of(lane(*h.who, h.name));
      return;
    }
    case Kind::Phase:
      return phase(h);
    case Kind::Vote:
    case Kind::DefaultVote:
      return vote(h);
    case Kind::Approved:
      return end(h, Protocol::End::kApproved);
    case Kind::Rejected:
      return end(h, Protocol::End::kRejected);
    case Kind::Failure:
      note(h, Mark::Shape::kFailure, h.codes.empty() ? "failed" : h.codes.front());
      if (h.who) end_stay(lane(*h.who, h.name), h.time_us);
      return;
    case Kind::Timer:
      return story_.marks.push_back({Mark::Shape::kNote, h.time_us, "time limit is over"});
    case Kind::Announcement:
      return story_.marks.push_back(
          {Mark::Shape::kNote, h.time_us, h.codes.empty() ? "announcement" : h.codes.front()});
  }
}

/// What is still open goes on to the end: in a phase that waits, everybody who could vote and has not is waited
/// for.
Story Teller::finish(Microseconds end) {
  if (runs_) {
    Protocol& protocol = story_.protocols.back();
    close_phase(protocol, end);
    protocol.to = end;
    for (std::size_t i = 0; i < open_.size() && !protocol.phases.empty(); ++i) {
      Phase& phase = protocol.phases.back();
      const bool voted =
          std::any_of(phase.waits.begin(), phase.waits.end(), [&](const Wait& w) { return w.lane == i; });
      const auto& changing = protocol.changing;
      const bool goes = is_departure(protocol.kind) &&
                        std::any_of(changing.begin(), changing.end(),
                                    [&](const inspect::Id& id) { return same(id, story_.lanes[i].id); });
      if (!voted && !goes && stays(i) && open_[i]->from < end)
        phase.waits.push_back({i, phase.from, end, false, ""});
    }
  }
  for (std::size_t i = 0; i < open_.size(); ++i) end_stay(i, end);
  return std::move(story_);
}

}  // namespace

Story story_of(const Recording& recording, const std::string& group) {
  Teller teller(recording, group);
  for (const HappeningT& h : recording.happenings) {
    if (h.group == group) teller.tell(h);
  }
  return teller.finish(end_of(recording));
}

std::vector<std::string> groups_of(const Recording& recording) {
  std::set<std::string> names;
  for (const auto& [name, members] : recording.groups) names.insert(name);
  for (const HappeningT& h : recording.happenings) {
    if (!h.group.empty()) names.insert(h.group);
  }
  return {names.begin(), names.end()};
}

Microseconds end_of(const Recording& recording) {
  Microseconds end = std::max(recording.started_us, recording.ended_us);
  for (const HappeningT& h : recording.happenings) end = std::max(end, h.time_us);
  return end;
}

}  // namespace gsctl
