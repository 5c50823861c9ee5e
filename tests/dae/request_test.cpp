// Serving requests, in this process: each action, bad input, mutated input.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/socket.h>
#include <unistd.h>

#include <random>

#include "dae/dae_internal.h"
#include "fake_kpl.h"

namespace {

const std::string kName(30, 'n');  // fills its field

std::string called;   // which routine ran, with what
std::string data_in;  // the extra data of the last own request

int other_req(short request, short parm1, short parm2, const void* data, int data_len) {
  called = "other " + std::to_string(request) + " " + std::to_string(parm1) + " " + std::to_string(parm2);
  data_in = data != nullptr ? static_cast<const char*>(data) : "";  // up to the NUL behind it
  EXPECT_EQ(data_in.size(), static_cast<size_t>(data_len));
  dae_inform_puts("informed");
  if (parm1 == 1) dae_error_puts("failed");
  return parm2;
}

const dae_req_sock_t kAllRoutines = {
    [] { called = "stop_normal"; },
    [] { called = "stop_forced"; },
    nullptr,
    [](int is_long) { called = is_long == 1 ? "trace_begin long" : "trace_begin"; },
    [] { called = "trace_end"; },
    [] { called = "refresh"; },
    [] {
      called = "long_status";
      dae_status_puts("a line\n");
    },
    other_req,
};

/// The bytes behind the type word.
std::string request(short object, short action, short parm1 = 0, short parm2 = 0) {
  kplreq record = {};
  record.subreq = {object, action, parm1, parm2, ""};
  kName.copy(record.subreq.objname, kName.size());
  const auto* bytes = reinterpret_cast<const char*>(&record);
  return std::string(bytes + offsetof(kplreq, kplhdr), bytes + sizeof record);
}

/// Makes this process look like a daemon under KPL with the given routines.
class Requests : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0 && getegid() != 0) GTEST_SKIP() << "request channels are for root";
  }

  ~Requests() override {
    close(sender_);
    close(descriptor_);
    dae_pid__INTERNAL__ = 0;
  }

  void become_daemon(const dae_req_sock_t& routines) {
    int ends[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, ends), 0);
    sender_ = ends[0];
    dup2(ends[1], 0);
    close(ends[1]);
    dae_init_KPL_sock(&descriptor_, &routines, 0);
    ASSERT_EQ(dae_KPL_init__INTERNAL__(&descriptor_), 0);
    ASSERT_EQ(open("/dev/null", O_RDWR), 0);  // the socket's place
    dae_pid__INTERNAL__ = getpid();
  }

  /// Sends the bytes and has them served.
  void serve(const std::string& bytes) {
    fake_kpl::reset();
    called.clear();
    ASSERT_EQ(send(sender_, bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
    errno = EDOM;
    dae_KPL_req();
    EXPECT_EQ(errno, EDOM);
  }

  /// Serves and returns the result code; what all replies have in common is checked here.
  short code_of(const std::string& bytes) {
    serve(bytes);
    svrreply body = {};
    if (fake_kpl::replies.size() != 1) {
      ADD_FAILURE() << fake_kpl::replies.size() << " replies";
      return 1;
    }
    const std::string& reply = fake_kpl::replies.front();
    reply.copy(reinterpret_cast<char*>(&body), sizeof body);
    EXPECT_EQ(reply.size(), 101 + strlen(body.rtnmsg));
    EXPECT_STREQ(body.rtnmsg, body.rtncode == KPL_RC_ERROR ? "failed\n" : "");
    EXPECT_STREQ(body.objtext, "");
    EXPECT_EQ(memcmp(&body.objtype, bytes.data() + sizeof(kplhdr), sizeof body.objtype), 0);
    EXPECT_EQ(body.objname, bytes.substr(sizeof(kplhdr) + offsetof(subreq, objname), 29));
    return body.rtncode;
  }

  int descriptor_ = -1;
  int sender_ = -1;
};

TEST_F(Requests, Actions_reach_their_routines_or_are_refused) {
  const struct {
    short object, action, parm1, parm2;
    int code;
    std::string routine;  // and what it wrote, but for error text
  } cases[] = {
      {17, 1, 0, 9, 0, "stop_normal"},
      {17, 1, 1, 9, 0, "stop_forced"},
      {17, 2, 1, 9, 0, "long_status[|a line;]"},
      {17, 4, 1, 1, 0, "trace_begin long"},
      {17, 4, 5, 1, 0, "trace_begin"},
      {17, 4, 1, 0, 0, "trace_end"},
      {17, 5, 9, 9, 0, "refresh"},
      {17, 256, 3, 0, 0, "other 256 3 0(informed)"},
      {17, 300, 1, 0, -1, "other 300 1 0(informed)"},
      {17, 32767, 1, 8, -9129, "other 32767 1 8(informed)"},
      {17, 0, 0, 0, -9129, ""},
      {17, 2, 0, 0, -9129, ""},
  };
  const short malformed[][4] = {{17, 3, 0, 0}, {17, 6, 0, 0}, {17, 255, 0, 0},    {17, -1, 0, 0}, {17, 1, 2, 0},
                                {17, 4, 0, 2}, {18, 3, 0, 0}, {18, -32768, 0, 0}, {18, 255, 0, 0}};
  const short elsewhere[][4] = {{18, 0, 0, 0}, {18, 1, 2, 0}, {18, 4, 0, 2},
                                {18, 2, 1, 0}, {18, 5, 0, 0}, {-1, 256, 0, 0}};
  become_daemon(kAllRoutines);
  for (const auto& c : cases) {
    EXPECT_EQ(code_of(request(c.object, c.action, c.parm1, c.parm2)), c.code) << c.action;
    EXPECT_EQ(called + fake_kpl::sent, c.routine);
  }
  for (const auto& [o, a, p, q] : malformed) EXPECT_EQ(code_of(request(o, a, p, q)), -9087) << o << " " << a;
  for (const auto& [o, a, p, q] : elsewhere) EXPECT_EQ(code_of(request(o, a, p, q)), -9129) << o << " " << a;
}

TEST_F(Requests, Without_routines_all_but_stop_is_not_supported) {
  become_daemon({});
  for (const auto& bytes : {request(17, 2, 1), request(17, 4, 0, 1), request(17, 4, 0, 0), request(17, 5),
                            request(17, 256), request(17, 256) + "data beyond the buffer"}) {
    EXPECT_EQ(code_of(bytes), -9129);
  }
  const auto serve_as_daemon = [&](short forced) {
    dae_pid__INTERNAL__ = getpid();
    serve(request(17, 1, forced));
  };
  EXPECT_EXIT(serve_as_daemon(0), testing::ExitedWithCode(0), "");
  EXPECT_EXIT(serve_as_daemon(1), testing::ExitedWithCode(0), "");
}

TEST_F(Requests, Length_and_process_decide_whether_there_is_a_reply) {
  become_daemon(kAllRoutines);
  const std::string whole = request(17, 300);
  for (const size_t length : {1, 118, 155}) {
    serve(whole.substr(0, length));
    EXPECT_TRUE(fake_kpl::replies.empty());
  }
  for (const auto& [sent, taken] : {std::pair(0, 0), {1, 1}, {5000, 2000 - 8 - 156}}) {
    EXPECT_EQ(code_of(whole + std::string(static_cast<size_t>(sent), 'd')), 0);
    EXPECT_EQ(data_in, std::string(static_cast<size_t>(taken), 'd'));
  }
  dae_pid__INTERNAL__ = getpid() + 1;  // in a child
  serve(request(17, 5));
  EXPECT_EQ(called, "");
  dae_pid__INTERNAL__ = getpid();
  dae_KPL_req();  // it still waits
  EXPECT_EQ(called, "refresh");
  called.clear();
  dae_KPL_req();  // nothing waits
  EXPECT_EQ(called, "");
}

TEST_F(Requests, Of_a_queue_only_the_own_type_is_taken_cut_to_the_buffer) {
  const int key = static_cast<int>(std::random_device()() | 1U);
  const int queue = msgget(key, IPC_CREAT | IPC_EXCL | 0660);
  ASSERT_NE(queue, -1);
  dae_init_KPL_msq(nullptr, key, 7, &kAllRoutines, 0);
  EXPECT_EQ(dae_KPL_init__INTERNAL__(nullptr), 0);
  dae_pid__INTERNAL__ = getpid();
  for (const auto& [type, bytes] : {std::pair(8L, request(17, 5)),
                                    {7L, request(17, 300).substr(0, 155)},
                                    {7L, request(17, 300) + std::string(3000, 'd')}}) {
    const std::string message = std::string(reinterpret_cast<const char*>(&type), sizeof type) + bytes;
    EXPECT_EQ(msgsnd(queue, message.data(), bytes.size(), 0), 0);
  }
  fake_kpl::reset();
  dae_KPL_req();
  EXPECT_TRUE(fake_kpl::replies.empty());
  dae_KPL_req();
  EXPECT_EQ(data_in, std::string(2000 - 8 - 156, 'd'));
  dae_KPL_req();  // nothing of that type waits
  EXPECT_EQ(fake_kpl::replies.size(), 1U);
  msgctl(queue, IPC_RMID, nullptr);
}

TEST_F(Requests, Mutated_requests_are_answered_or_ignored) {
  constexpr unsigned kSeed = 20240607;
  std::mt19937 random(kSeed);
  const auto below = [&](size_t bound) { return static_cast<size_t>(random() % bound); };
  const short actions[] = {0, 1, 2, 3, 4, 5, 255, 256, 300, -1};
  become_daemon(kAllRoutines);
  for (int round = 0; round < 3000; ++round) {
    const auto small = [&] { return static_cast<short>(below(3)); };
    std::string bytes =
        request(17, actions[below(std::size(actions))], small(), small()) + std::string(below(3000), 'd');
    for (size_t i = below(4); i > 0; --i) bytes[below(bytes.size())] = static_cast<char>(1 + below(255));
    if (below(4) == 0) bytes.resize(1 + below(bytes.size()));
    if (bytes.size() < 156) {
      serve(bytes);
      EXPECT_TRUE(fake_kpl::replies.empty());
    } else {
      EXPECT_THAT(code_of(bytes), testing::AnyOf(0, -1, -9087, -9129));
    }
    if (called.starts_with("other")) {
      EXPECT_EQ(data_in, bytes.substr(156, 2000 - 8 - 156));
    }
    ASSERT_FALSE(HasFailure()) << "seed " << kSeed << " round " << round;
  }
}

}  // namespace
