// Serving requests over both message transports, in this process: each action, bad input, mutated input.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <random>
#include <string>
#include <utility>

#include "dae/dae_internal.h"
#include "fake_kpl.h"

namespace {

using testing::ElementsAre;
using testing::IsEmpty;

/// A System V queue of its own, gone with the object.
class Queue {
 public:
  Queue() {
    std::random_device random;
    do {
      key_ = static_cast<int>(random() | 1u);
      id_ = msgget(key_, IPC_CREAT | IPC_EXCL | 0660);
    } while (id_ == -1 && errno == EEXIST);
  }
  ~Queue() { msgctl(id_, IPC_RMID, nullptr); }
  Queue(const Queue&) = delete;
  Queue& operator=(const Queue&) = delete;
  int key() const { return key_; }
  int id() const { return id_; }

 private:
  int key_;
  int id_;
};

constexpr int kType = 7;

std::string called;   // which routine ran, with what
std::string data_in;  // the extra data of the last own request
int other_result = 0;

void long_status() {
  called = "long_status";
  dae_status_puts("a line\n");
}

int other_req(short request, short parm1, short parm2, const void* data, int data_len) {
  called = "other " + std::to_string(request) + " " + std::to_string(parm1) + " " + std::to_string(parm2);
  data_in.clear();
  if (data != nullptr) {
    data_in.assign(static_cast<const char*>(data), static_cast<size_t>(data_len));
    EXPECT_EQ(static_cast<const char*>(data)[data_len], '\0');
  }
  EXPECT_EQ(data == nullptr, data_len == 0);
  dae_inform_puts("informed");
  if (parm1 == 1) dae_error_puts("failed");
  return other_result;
}

const dae_req_sock_t kAllRoutines = {
    [] { called = "stop_normal"; },
    [] { called = "stop_forced"; },
    nullptr,
    [](int is_long) { called = is_long ? "trace_begin long" : "trace_begin"; },
    [] { called = "trace_end"; },
    [] { called = "refresh"; },
    long_status,
    other_req,
};

/// The bytes behind the type word.
std::string request(short object, short action, short parm1 = 0, short parm2 = 0, const std::string& data = "",
                    const std::string& name = "subsys") {
  kplreq record = {};
  record.kplhdr.dversion = 3;
  record.subreq.object = object;
  record.subreq.action = action;
  record.subreq.parm1 = parm1;
  record.subreq.parm2 = parm2;
  memcpy(record.subreq.objname, name.data(), std::min(name.size(), sizeof record.subreq.objname));
  const auto* bytes = reinterpret_cast<const char*>(&record);
  return std::string(bytes + offsetof(kplreq, kplhdr), bytes + sizeof record) + data;
}

/// Makes this process look like a daemon under KPL with the given transport and routines.
class Requests : public testing::TestWithParam<dae_KPL_comm_t> {
 protected:
  void SetUp() override {
    if (geteuid() != 0 && getegid() != 0) GTEST_SKIP() << "the transports are for root";
    fake_kpl::reset();
    called.clear();
    other_result = 0;
    saved_stdin_ = fcntl(0, F_DUPFD_CLOEXEC, 10);
  }

  void TearDown() override {
    if (saved_stdin_ >= 0) dup2(saved_stdin_, 0);
    for (const int fd : {saved_stdin_, sender_, GetParam() == DAE_C_SOCK ? descriptor_ : -1}) close(fd);
    dae_pid__INTERNAL__ = 0;
  }

  void become_daemon(const dae_req_sock_t& routines) {
    dae_pid__INTERNAL__ = 0;
    if (GetParam() == DAE_C_SOCK) {
      int ends[2];
      ASSERT_EQ(socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, ends), 0);
      sender_ = ends[0];
      dup2(ends[1], 0);
      close(ends[1]);
      descriptor_ = -1;
      dae_init_KPL_sock(&descriptor_, &routines, 0);
    } else {
      dae_init_KPL_msq(&descriptor_, queue_.key(), kType, &routines, 0);
    }
    ASSERT_EQ(dae_KPL_init__INTERNAL__(&descriptor_), 0);
    dup2(saved_stdin_, 0);
    dae_pid__INTERNAL__ = getpid();
  }

  /// Sends the bytes and has them served.
  void serve(const std::string& bytes) {
    fake_kpl::packets.clear();
    called.clear();
    if (GetParam() == DAE_C_SOCK) {
      ASSERT_EQ(send(sender_, bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
    } else {
      std::string message(sizeof(long), '\0');
      message[0] = kType;
      message += bytes;
      ASSERT_EQ(msgsnd(queue_.id(), message.data(), bytes.size(), 0), 0);
    }
    errno = EDOM;
    dae_KPL_req();
    EXPECT_EQ(errno, EDOM);
  }

  /// The final reply; its shape is checked here for all.
  svrreply reply() {
    svrreply body = {};
    if (fake_kpl::packets.empty()) {
      ADD_FAILURE() << "no reply";
      return body;
    }
    const auto& last = fake_kpl::packets.back();
    EXPECT_EQ(last.cont, KPL_CONT_END);
    EXPECT_EQ(std::count_if(fake_kpl::packets.begin(), fake_kpl::packets.end(),
                            [](const auto& packet) { return packet.cont == KPL_CONT_END; }),
              1);
    memcpy(&body, last.bytes.data() + sizeof(kplhdr), std::min(sizeof body, last.bytes.size() - sizeof(kplhdr)));
    EXPECT_EQ(last.bytes.size(), 219 + strlen(body.rtnmsg));
    EXPECT_STREQ(body.objtext, "");
    return body;
  }

  int code_of(const std::string& bytes) {
    serve(bytes);
    return reply().rtncode;
  }

  Queue queue_;
  int descriptor_ = -1;
  int sender_ = -1;
  int saved_stdin_ = -1;
};

INSTANTIATE_TEST_SUITE_P(Transports, Requests, testing::Values(DAE_C_SOCK, DAE_C_MSQ),
                         [](const auto& param) { return param.param == DAE_C_SOCK ? "socket" : "queue"; });

TEST_P(Requests, Every_action_reaches_its_routine) {
  become_daemon(kAllRoutines);
  const struct {
    short action, parm1, parm2;
    const char* routine;
  } cases[] = {{1, 0, 9, "stop_normal"},      {1, 1, 9, "stop_forced"},    {2, 1, 9, "long_status"},
               {4, 1, 1, "trace_begin long"}, {4, 5, 1, "trace_begin"},    {4, 1, 0, "trace_end"},
               {5, 9, 9, "refresh"},          {256, 3, 4, "other 256 3 4"}};
  for (const auto& c : cases) {
    EXPECT_EQ(code_of(request(17, c.action, c.parm1, c.parm2)), 0);
    EXPECT_EQ(called, c.routine);
    EXPECT_EQ(reply().objtype, 17);
    EXPECT_STREQ(reply().objname, "subsys");
  }
}

TEST_P(Requests, What_makes_no_sense_is_refused) {
  become_daemon(kAllRoutines);
  const struct {
    short object, action, parm1, parm2;
    int code;
  } cases[] = {{17, 0, 0, 0, -9129},  {17, 3, 0, 0, -9087},      {17, 6, 0, 0, -9087},   {17, 255, 0, 0, -9087},
               {17, -1, 0, 0, -9087}, {17, -32768, 0, 0, -9087}, {17, 1, 2, 0, -9087},   {17, 4, 0, 2, -9087},
               {17, 2, 0, 0, -9129},  {17, 2, 2, 0, -9129},      {18, 1, 2, 0, -9129},   {18, 4, 0, 2, -9129},
               {18, 0, 0, 0, -9129},  {18, 3, 0, 0, -9087},      {18, 255, 0, 0, -9087}, {18, -1, 0, 0, -9087},
               {18, 2, 1, 0, -9129},  {18, 5, 0, 0, -9129},      {18, 256, 0, 0, -9129}, {-1, 32767, 0, 0, -9129}};
  for (const auto& c : cases) {
    EXPECT_EQ(code_of(request(c.object, c.action, c.parm1, c.parm2)), c.code) << c.object << " " << c.action;
    EXPECT_EQ(reply().objtype, c.object);
    EXPECT_EQ(called, "");
    EXPECT_STREQ(reply().rtnmsg, "");
  }
}

TEST_P(Requests, Without_routines_all_but_stop_is_not_supported) {
  become_daemon({});
  for (const auto& bytes : {request(17, 2, 1), request(17, 4, 0, 1), request(17, 4, 0, 0), request(17, 5),
                            request(17, 256), request(17, 256, 0, 0, "data beyond the buffer")}) {
    EXPECT_EQ(code_of(bytes), -9129);
  }
  for (const short forced : {0, 1}) {
    const auto serve_as_daemon = [&] {
      dae_pid__INTERNAL__ = getpid();
      serve(request(17, 1, forced));
    };
    EXPECT_EXIT(serve_as_daemon(), testing::ExitedWithCode(0), "");
  }
}

TEST_P(Requests, Length_decides_about_silence_and_data) {
  become_daemon(kAllRoutines);
  const std::string whole = request(17, 300, 0, 0);
  ASSERT_EQ(whole.size(), 156u);
  for (const size_t length : {1u, 118u, 155u}) {
    serve(whole.substr(0, length));
    EXPECT_THAT(fake_kpl::packets, IsEmpty());
  }
  EXPECT_EQ(code_of(whole), 0);
  EXPECT_EQ(data_in, "");
  EXPECT_EQ(code_of(whole + "d"), 0);
  EXPECT_EQ(data_in, "d");
  EXPECT_EQ(code_of(whole + std::string(5000, 'd')), 0);
  EXPECT_EQ(data_in, std::string(2000 - 8 - 156, 'd'));

  fake_kpl::packets.clear();
  dae_KPL_req();  // nothing waits: nothing happens
  EXPECT_THAT(fake_kpl::packets, IsEmpty());
}

TEST_P(Requests, Output_decides_about_the_reply) {
  become_daemon(kAllRoutines);
  EXPECT_EQ(code_of(request(17, 300, 1)), -1);
  EXPECT_STREQ(reply().rtnmsg, "failed\n");
  EXPECT_THAT(fake_kpl::messages(), ElementsAre("informed"));
  other_result = 1;  // refused: the error text is dropped, the message still goes
  EXPECT_EQ(code_of(request(17, 300, 1)), -9129);
  EXPECT_STREQ(reply().rtnmsg, "");
  EXPECT_THAT(fake_kpl::messages(), ElementsAre("informed"));
  EXPECT_EQ(code_of(request(17, 2, 1)), 0);
  EXPECT_THAT(fake_kpl::status_lines(), ElementsAre(fake_kpl::Line{"", "a line"}));
}

TEST_P(Requests, Names_that_fill_their_field_are_cut) {
  become_daemon(kAllRoutines);
  EXPECT_EQ(code_of(request(17, 5, 0, 0, "", std::string(30, 'n'))), 0);
  EXPECT_EQ(reply().objname, std::string(29, 'n'));
}

TEST_P(Requests, Only_the_daemon_itself_serves) {
  become_daemon(kAllRoutines);
  dae_pid__INTERNAL__ = getpid() + 1;
  serve(request(17, 5));
  EXPECT_THAT(fake_kpl::packets, IsEmpty());
  dae_pid__INTERNAL__ = getpid();
  dae_KPL_req();  // it still waits
  EXPECT_EQ(called, "refresh");
}

TEST_P(Requests, Mutated_requests_are_answered_or_ignored) {
  constexpr unsigned kSeed = 20240607;
  std::mt19937 random(kSeed);
  const auto below = [&](size_t bound) { return static_cast<size_t>(random() % bound); };
  for (const bool with_data : {true, false}) {
    dae_req_sock_t routines = kAllRoutines;
    if (!with_data) routines.dae_other_req = nullptr;
    become_daemon(routines);
    const short actions[] = {0, 1, 2, 3, 4, 5, 255, 256, 300, -1};
    for (int round = 0; round < 2000; ++round) {
      const auto small = [&] { return static_cast<short>(below(3)); };
      std::string bytes = request(17, actions[below(std::size(actions))], small(), small(),
                                  std::string(below(3000), 'd'), std::string(below(31), 'n'));
      for (size_t i = below(4); i > 0; --i) bytes[below(bytes.size())] = static_cast<char>(random());
      if (below(4) == 0) bytes.resize(1 + below(bytes.size()));
      serve(bytes);
      if (bytes.size() < 156) {
        EXPECT_THAT(fake_kpl::packets, IsEmpty());
        continue;
      }
      EXPECT_THAT(reply().rtncode, testing::AnyOf(0, -1, -9087, -9129));
      if (called.starts_with("other")) {
        EXPECT_EQ(data_in, bytes.substr(156, 2000 - 8 - 156));
      }
      ASSERT_FALSE(HasFailure()) << "seed " << kSeed << " round " << round;
    }
    close(std::exchange(sender_, -1));
    if (GetParam() == DAE_C_SOCK) close(std::exchange(descriptor_, -1));
  }
}

}  // namespace
