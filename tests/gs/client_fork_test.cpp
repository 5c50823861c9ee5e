// A fork: the session stays the parent's, whatever the child does, and the child can have its own.

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>

#include <future>

#include "gscl/gscl.h"
#include "support/client_fixture.h"
#include "support/fake_gsd.h"

namespace test_support {
namespace {

/// The number of the first promise that is broken in a child; 0: none.
int broken_in_child(int parents_descriptor, wyx_token_t parents_token) {
  if (wyx_dispatch(WYX_NON_BLOCKING) != WYX_NO_INIT || wyx_dispatch(WYX_BLOCKING) != WYX_NO_INIT) return 1;
  if (send_message(parents_token, "x") != WYX_NO_INIT || wyx_quit() != WYX_NO_INIT) return 2;
  if (last_failure() != "") return 3;
  if (fcntl(parents_descriptor, F_GETFD) != FD_CLOEXEC || readable(parents_descriptor)) return 4;
  if (const char* endpoint = getenv("GSD_OF_CHILD")) setenv("GSD_ENDPOINT", endpoint, 1);
  const SetupResult own = setup();
  if (own.rc != WYX_OK || own.descriptor == parents_descriptor) return 5;
  if (send_message(parents_token, "x") != WYX_BAD_MEMBER_TOKEN) return 6;
  Group group("of the child");
  wyx_token_t token = -1;
  if (join(group, 1, &token) != WYX_OK || token == parents_token) return 7;
  if (!dispatch_until(own.descriptor, [&] { return !Recorder::get().of(token).empty(); })) return 8;
  if (wyx_quit() != WYX_OK || fcntl(parents_descriptor, F_GETFD) == -1) return 9;
  return 0;
}

void expect_unbroken(pid_t child) {
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status)) << status;
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

class Fork : public ClientTest {};
INSTANTIATE_TEST_SUITE_P(Endpoints, Fork, kEndpoints, endpoint_name);

TEST_P(Fork, InsideACallback_endsTheChildsDispatchAndHarmsNobody) {
  const wyx_token_t token = joined(Group("g"));
  pid_t child = -1;
  recorder().set_hook([&](const Seen&) {
    if (child == -1) child = fork();
  });
  EXPECT_EQ(send_message(token, "first"), WYX_OK);
  ASSERT_TRUE(readable(fd(), 60000));
  const wyx_rc_t dispatched = wyx_dispatch(WYX_NON_BLOCKING);
  if (child == 0) exit(dispatched == WYX_NO_INIT ? broken_in_child(fd(), token) : 99);
  EXPECT_EQ(dispatched, WYX_OK);
  expect_unbroken(child);
  EXPECT_EQ(send_message(token, "second"), WYX_OK);
  EXPECT_TRUE(all_arrive(token, 2));
}

TEST_P(Fork, ClassesInTheChild_areDestroyedWithoutHarm) {
  wyx_quit();
  auto* controller = new zelt_gscl_V1::GSController;
  ASSERT_EQ(controller->initialize(), WYX_OK);
  auto* provider = new zelt_gscl_V1::GSProvider("classes", 1, "local");
  ASSERT_EQ(provider->joinGroup(), WYX_OK);
  const auto is_joined = [&] { return provider->getClientState() == zelt_gscl::GS_IAM_JOINED; };
  ASSERT_TRUE(dispatch_until(controller->getGSDescriptor(), is_joined));
  const pid_t child = fork();
  if (child == 0) {
    const bool refused = provider->goodbyeGroup() == WYX_NO_INIT && controller->quit() == WYX_NO_INIT;
    delete provider;
    delete controller;
    exit(refused ? 0 : 1);
  }
  expect_unbroken(child);
  EXPECT_EQ(provider->goodbyeGroup(), WYX_OK);
  delete provider;
  EXPECT_EQ(controller->quit(), WYX_OK);
  delete controller;
}

TEST(ForkOfThreads, ThatWaitInTheLibrary_doesNotHangTheChild) {
  FakeGsd fake;
  GsdProcess daemon;
  setenv("GSD_ENDPOINT", fake.endpoint().c_str(), 1);
  setenv("GSD_OF_CHILD", daemon.endpoint().c_str(), 1);
  auto accepted = std::async(std::launch::async, [&] { return fake.accept_session(); });
  const int descriptor = setup().descriptor;
  FakeSession session = accepted.get();
  auto dispatching = std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); });
  std::vector<std::future<wyx_rc_t>> asking;
  for (int i = 0; i < 3; ++i) {
    asking.push_back(std::async(std::launch::async, [] {
      wyx_token_t token = -1;
      return subscribe("g", WYX_SUBSCRIBE_STATE, &token);
    }));
  }
  session.request.receive<gs::wire::Call>();  // the others wait for their turn
  const pid_t child = fork();
  if (child == 0) _exit(broken_in_child(descriptor, 1));
  expect_unbroken(child);
  for (int answers = 0; answers < 3; ++answers) {
    if (answers > 0) session.request.receive<gs::wire::Call>();
    session.request.send(gs::wire::Answer{WYX_OK});
  }
  for (auto& one : asking) EXPECT_EQ(one.get(), WYX_OK);
  auto quitting = std::async(std::launch::async, [] { return wyx_quit(); });
  session.request.receive<gs::wire::Quit>();
  session.request.send(gs::wire::Answer{WYX_OK});
  EXPECT_EQ(quitting.get(), WYX_OK);
  EXPECT_EQ(dispatching.get(), WYX_NO_INIT);
  unsetenv("GSD_OF_CHILD");
}

/// Joins, forks a child that lives until `alive` has no writer, says so and waits for its own end.
[[noreturn]] void member_with_child(int alive, int ready) {
  Group group("g");
  wyx_token_t token = -1;
  const SetupResult opened = setup();
  const bool ok = opened.rc == WYX_OK && join(group, 2, &token) == WYX_OK;
  char byte = ok ? 'y' : 'n';
  if (fork() == 0) {
    while (read(alive, &byte, 1) > 0) {
    }
    _exit(0);
  }
  if (write(ready, &byte, 1) == 1) pause();
  _exit(1);
}

class ForkOfAMember : public SessionTest {};

TEST_F(ForkOfAMember, ThatIsKilled_leavesItsGroupAlthoughItsChildLives) {
  GsdProcess daemon;
  setenv("GSD_ENDPOINT", daemon.endpoint().c_str(), 1);
  int alive[2], ready[2];
  ASSERT_EQ(pipe2(alive, O_CLOEXEC) + pipe2(ready, O_CLOEXEC), 0);
  const pid_t member = fork();
  if (member == 0) {
    close(alive[1]);
    member_with_child(alive[0], ready[1]);
  }
  char answer = 'n';
  ASSERT_EQ(read(ready[0], &answer, 1), 1);
  ASSERT_EQ(answer, 'y');
  recorder().reset();
  open();
  const wyx_token_t watcher = joined(Group("g"));
  kill(member, SIGKILL);
  EXPECT_EQ(waitpid(member, nullptr, 0), member);
  EXPECT_TRUE(all_arrive(watcher, 1));
  EXPECT_EQ(recorder().of(watcher).at(0).protocol().protocol, WYX_FAILURE_LEAVE);
  for (const int fd : {alive[0], alive[1], ready[0], ready[1]}) close(fd);
}

}  // namespace
}  // namespace test_support
