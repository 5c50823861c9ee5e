#include <gtest/gtest.h>

#include "gs/daemon_memory.h"
#include "inspect/messages.h"

namespace gs::daemon {
namespace {

using namespace std::chrono_literals;
using inspect::Kind;
using inspect::What;

/// A connection that asks the daemon about itself.
class Asker {
 public:
  explicit Asker(MemoryDaemon& daemon) : daemon_(daemon), id(daemon.open()) {}

  std::vector<inspect::ReportT> reports() {
    std::vector<inspect::ReportT> all;
    std::string error;
    for (const auto& message : daemon_.transport.take(id))
      all.push_back(
          inspect::read_report(std::as_bytes(std::span(std::get<wire::Report>(message).report)), &error).value());
    return all;
  }
  inspect::ReportT ask(inspect::AskT ask) {
    daemon_.say(id, wire::Inspect{inspect::write(ask)});
    return reports().at(0);
  }
  inspect::ReportT ask(What what, std::vector<std::string> groups = {}, bool contents = false) {
    inspect::AskT asked;
    asked.what = what;
    asked.groups = std::move(groups);
    asked.contents = contents;
    return ask(std::move(asked));
  }
  /// "kind group" of each happening since the last look.
  std::string happened() {
    std::string all;
    for (const auto& report : reports()) {
      missed += report.missed;
      for (const auto& h : report.happenings) all += inspect::EnumNameKind(h->kind) + (" " + h->group + ";");
    }
    return all;
  }

  std::uint64_t missed = 0;

 private:
  MemoryDaemon& daemon_;

 public:
  const ConnectionId id;
};

struct Inspection : testing::Test {
  MemoryDaemon daemon;
  Asker asker{daemon};
};

TEST_F(Inspection, VotesThatAreMissing_AreNamedWithTheirProcess) {
  MemoryClient first(daemon), second(daemon);
  ASSERT_EQ(first.join(1, 1), WYX_OK);
  ASSERT_EQ(second.join(1, 2), WYX_OK);
  daemon.pass(5s);
  ASSERT_EQ(first.call(StateChangeRequest{1, {WYX_N_PHASE, 60}, "new"}), WYX_OK);
  daemon.pass(2s);
  ASSERT_EQ(second.call(VoteRequest{1, WYX_VOTE_APPROVE, {}, {}}), WYX_OK);

  const auto report = asker.ask(What::Groups, {"group", "another"}, true);
  ASSERT_EQ(report.groups.size(), 1u);
  const inspect::GroupT& group = *report.groups[0];
  ASSERT_TRUE(group.running);
  EXPECT_EQ(group.running->kind, "state");
  EXPECT_EQ(group.running->phase_age_ms, 2000);
  ASSERT_EQ(group.running->missing.size(), 1u);
  EXPECT_EQ(group.running->missing[0]->id->instance(), 1);
  EXPECT_EQ(group.running->voted.size(), 1u);
  EXPECT_EQ(group.state, "");

  const auto members = asker.ask(What::Members, {"group"});
  ASSERT_EQ(members.members.size(), 2u);
  EXPECT_EQ(members.members[0]->process->pid, 4711u);
  EXPECT_EQ(members.members[0]->age_ms, 7000);
  const auto status = asker.ask(What::Daemon);
  EXPECT_TRUE(status.daemon->serving);
  EXPECT_EQ(asker.ask(What::Sessions).sessions.size(), 2u);
}

TEST_F(Inspection, LongLists_ComeInPagesThatLeaveOutNothing) {
  MemoryClient member(daemon);
  const int groups = 600;
  for (int i = 0; i < groups; ++i) {
    ASSERT_EQ(member.join(i, 1, "group" + std::to_string(i)), WYX_OK);
    ASSERT_EQ(member.call(SubscribeRequest{groups + i, WYX_SUBSCRIBE_STATE, "group" + std::to_string(i % 2)}),
              WYX_OK);
  }
  member.events();
  const auto count = [&](What what, auto list) {
    inspect::AskT ask;
    ask.what = what;
    std::size_t seen = 0;
    for (;;) {
      const auto page = asker.ask(ask);
      seen += (page.*list).size();
      if (!page.more) return seen;
      ask.after = page.next_group;
      ask.from = page.next;
    }
  };
  EXPECT_EQ(count(What::Groups, &inspect::ReportT::groups), 600u);
  for (int i = groups; i < 2 * groups; ++i)
    ASSERT_EQ(member.call(SubscribeRequest{groups + i, WYX_SUBSCRIBE_STATE, "group1"}), WYX_OK);
  EXPECT_EQ(count(What::Subscribers, &inspect::ReportT::subscribers), 1200u);
}

TEST_F(Inspection, TapThatDoesNotRead_MissesWhatItIsToldTheNumberOf_AndNobodyFeelsIt) {
  Asker slow(daemon), other(daemon), approvals(daemon);
  MemoryClient member(daemon);
  inspect::AskT tap;
  tap.what = What::Tap;
  tap.groups = {"group"};
  tap.contents = true;
  slow.ask(tap);
  tap.groups = {"other"};
  other.ask(tap);
  tap.groups = {};
  tap.kinds = {Kind::Approved, static_cast<Kind>(200)};
  approvals.ask(tap);
  ASSERT_EQ(member.join(1, 1), WYX_OK);
  daemon.pass(1s);
  EXPECT_EQ(slow.happened(), "Request group;Begin group;Approved group;");
  EXPECT_EQ(approvals.happened(), "Approved group;");

  daemon.transport.wires.at(slow.id).full = true;
  const int changes = 100;
  for (int i = 0; i < changes; ++i) {
    ASSERT_EQ(member.call(StateChangeRequest{1, {WYX_1_PHASE, 0}, std::string(kMaxStateValue, 's')}), WYX_OK);
    member.events();
    daemon.pass(1s);
  }
  EXPECT_FALSE(daemon.closed(slow.id));
  EXPECT_FALSE(member.closed());
  auto& wire = daemon.transport.wires.at(slow.id);
  wire.full = false;
  while (std::exchange(wire.wants_writable, false)) daemon.layer.writable(slow.id);
  daemon.pass(1s);
  const std::string seen = slow.happened();
  const auto lines = static_cast<std::uint64_t>(std::count(seen.begin(), seen.end(), ';'));
  EXPECT_GT(slow.missed, 0u);
  EXPECT_EQ(lines + slow.missed, 3u * changes);
  EXPECT_EQ(other.happened(), "");
  daemon.say(slow.id, wire::Inspect{inspect::write(tap)});
  EXPECT_TRUE(daemon.closed(slow.id));
  daemon.ordering.fail("an event could not be applied");
  EXPECT_TRUE(daemon.closed(approvals.id)) << "what it has seen does not go on";
}

TEST_F(Inspection, QuestionWhosePartsAreTheSameBytes_IsMalformed) {
  flatbuffers::FlatBufferBuilder builder;
  const auto name = builder.CreateString(std::string(1000, 'g'));
  const auto groups = builder.CreateVector(std::vector(200, name));
  builder.Finish(inspect::CreateAsk(builder, What::Groups, groups));
  const std::string bytes(reinterpret_cast<const char*>(builder.GetBufferPointer()), builder.GetSize());
  daemon.say(asker.id, wire::Inspect{bytes});
  EXPECT_TRUE(daemon.closed(asker.id));
}

TEST_F(Inspection, NumbersOfAGroupThatIsBornAgain_GoOnAboveThoseOfAll) {
  MemoryClient member(daemon);
  std::uint64_t last = 0;
  for (const char* name : {"one", "two", "one"}) {
    ASSERT_EQ(member.join(1, 1, name), WYX_OK);
    const std::uint64_t number = asker.ask(What::Groups).groups.at(0)->event_number;
    EXPECT_GT(number, last) << name;
    ASSERT_EQ(member.call(LeaveRequest{1, {}, 0}), WYX_OK);
    last = number;
  }
}

}  // namespace
}  // namespace gs::daemon
