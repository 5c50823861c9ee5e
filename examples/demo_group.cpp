// The first act: a private daemon, three members and a watcher on one host.
#include <cstdio>
#include <string>

#include "examples/demo.h"
#include "examples/processes.h"
#include "examples/stage.h"

void zn::demo_group() {
  const std::string member = program("member");
  PrivateDaemon daemon;
  const Process::Environment environment = daemon.environment();
  Stage stage(Stage::Numbers::kWithoutGaps);

  stage.start(0, {member, "crew", "1"}, environment);
  stage.expect({{"1 joins; members: 1", {1}, ""}, {"1 leads", {1}, ""}});
  stage.start(Stage::kWatcher, {program("watcher"), "crew"}, environment);
  stage.expect({{"", {}, "members: 1; state: \"\""}});
  stage.start(1, {member, "crew", "2", "panic"}, environment);
  stage.expect({{"2 joins; members: 1 2", {1, 2}, "members: 1 2; state: \"\""}});
  stage.start(2, {member, "crew", "3"}, environment);
  stage.expect({{"3 joins; members: 1 2 3", {1, 2, 3}, "members: 1 2 3; state: \"\""}});

  stage.command(0, "state ready");
  stage.expect({{"1 proposes state \"ready\", phase 1", {1, 2, 3}, ""},
                {"1 proposes state \"ready\", phase 2", {1, 2, 3}, ""},
                {"approved; the state is \"ready\"", {1, 2, 3}, "members: 1 2 3; state: \"ready\""}});
  stage.command(2, "state panic");
  stage.expect({{"3 proposes state \"panic\", phase 1", {1, 2, 3}, ""},
                {"rejected; the state stays \"ready\"", {1, 2, 3}, ""}});
  stage.command(1, "say all hands on deck");
  stage.expect({{"2 says \"all hands on deck\"", {1, 2, 3}, ""}});

  stage.kill(2);
  stage.expect({{"3 has failed, WYX_PROVIDER_FAILURE; members: 1 2", {1, 2}, "members: 1 2; state: \"ready\""}});
  stage.expect_end(2, true);
  stage.command(1, "leave");
  stage.expect({{"2 leaves; members: 1", {1, 2}, "members: 1; state: \"ready\""}});
  stage.expect_end(1, false);
  stage.command(0, "leave");
  stage.expect(
      {{"1 leaves; members: none", {1}, "members: none; state: \"ready\""}, {"", {}, "the group is gone"}});
  stage.expect_end(0, false);
  stage.expect_end(Stage::kWatcher, false);

  if (!daemon.stop(Clock::now() + kStepLimit)) throw Failure{"the daemon did not stop in order: " + daemon.log()};
  std::printf("\nEverybody saw the same events in the same order. Times in milliseconds; %.0f in all.\n",
              stage.milliseconds());
}
