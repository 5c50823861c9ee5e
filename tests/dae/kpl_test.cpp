// The KPL library itself: where replies go, and asking a master for short status.
#include "kpl.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <thread>
#include <vector>

#include "datagram.h"

namespace {

using testing::ElementsAre;

size_t open_descriptors() {
  size_t count = 0;
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) ++count;
  return count;
}

/// Begins the answer to a request with that return address.
kplhdr* begin(const sockaddr_un& retaddr) {
  // Requests lie in their buffer at any alignment.
  static char request[1 + sizeof(kplhdr)];
  kplhdr header = {};
  header.retaddr = retaddr;
  header.dversion = 5;
  memcpy(request + 1, &header, sizeof header);
  return kplrrqs(request + 1);
}

int reply(kplhdr* header, int cont, const std::string& body = "") {
  std::string bytes(sizeof(kplhdr), '#');
  bytes += body;
  const int result = kplsrpy(header, bytes.data(), static_cast<int>(bytes.size()), cont);
  EXPECT_EQ(bytes.substr(0, sizeof(kplhdr)), std::string(sizeof(kplhdr), '#'));  // the caller's stays as it is
  return result;
}

kplhdr header_of(const std::string& packet) {
  kplhdr header = {};
  memcpy(&header, packet.data(), std::min(packet.size(), sizeof header));
  return header;
}

TEST(KplReply, Packets_arrive_with_the_requests_header) {
  const size_t before = open_descriptors();
  {
    Datagram requester;
    kplhdr* header = begin(requester.address());
    EXPECT_EQ(reply(header, KPL_CONT_MESSAGE, "interim"), 0);
    EXPECT_EQ(reply(header, KPL_CONT_END, "last"), 0);
    const std::string interim = requester.receive();
    const std::string last = requester.receive();
    EXPECT_EQ(interim.substr(sizeof(kplhdr)), "interim");
    EXPECT_EQ(last.substr(sizeof(kplhdr)), "last");
    EXPECT_EQ(header_of(interim).cont, KPL_CONT_MESSAGE);
    EXPECT_EQ(header_of(last).cont, KPL_CONT_END);
    EXPECT_EQ(header_of(last).dversion, 5);
    EXPECT_EQ(memcmp(header_of(last).retaddr.sun_path, requester.address().sun_path, 108), 0);
  }
  EXPECT_EQ(open_descriptors(), before);
}

TEST(KplReply, A_path_may_fill_the_address_without_an_end) {
  char folder[] = "/tmp/kpl_XXXXXX";
  ASSERT_NE(mkdtemp(folder), nullptr);
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  std::string path = std::string(folder) + "/";
  path.append(sizeof address.sun_path - path.size(), 'p');
  path.copy(address.sun_path, sizeof address.sun_path);
  const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);

  EXPECT_EQ(reply(begin(address), KPL_CONT_END), 0);
  char packet[200];
  EXPECT_EQ(recv(fd, packet, sizeof packet, MSG_DONTWAIT), static_cast<ssize_t>(sizeof(kplhdr)));
  close(fd);
  std::filesystem::remove_all(folder);
}

TEST(KplReply, Requesters_that_nobody_is_cost_nothing) {
  const size_t before = open_descriptors();
  sockaddr_un gone;
  {
    Datagram requester;
    gone = requester.address();
  }
  const auto error_of = [](const sockaddr_un& address) {
    kplhdr* header = begin(address);
    EXPECT_EQ(reply(header, KPL_CONT_STATUS), -1);
    const int error = errno;
    EXPECT_EQ(reply(header, KPL_CONT_END), -1);
    return error;
  };
  EXPECT_EQ(error_of(gone), ECONNREFUSED);
  EXPECT_EQ(error_of({}), EDESTADDRREQ);
  sockaddr_un nameless = {};
  nameless.sun_family = AF_UNIX;
  EXPECT_EQ(error_of(nameless), EDESTADDRREQ);
  nameless.sun_path[0] = '/';
  nameless.sun_path[1] = 'x';
  EXPECT_EQ(error_of(nameless), ENOENT);
  char packet[sizeof(kplhdr)] = {};
  EXPECT_EQ(kplsrpy(begin(gone), packet, sizeof packet - 1, 0), -1);
  EXPECT_EQ(errno, EINVAL);

  Datagram there;  // the one before is forgotten
  EXPECT_EQ(reply(begin(there.address()), KPL_CONT_END), 0);
  EXPECT_EQ(open_descriptors(), before + 1);
}

TEST(KplReply, Slow_requesters_lose_nothing) {
  constexpr int kPackets = 300;  // far more than a socket's queue takes
  Datagram requester;
  std::vector<int> received;
  std::thread reader([&] {
    while (received.size() < kPackets) {
      const std::string packet = requester.receive();
      if (packet.size() != sizeof(kplhdr) + sizeof(int)) break;
      received.emplace_back();
      memcpy(&received.back(), packet.data() + sizeof(kplhdr), sizeof(int));
    }
  });
  kplhdr* header = begin(requester.address());
  for (int i = 0; i < kPackets; ++i) {
    EXPECT_EQ(reply(header, i == kPackets - 1 ? KPL_CONT_END : KPL_CONT_STATUS,
                    std::string(reinterpret_cast<const char*>(&i), sizeof i)),
              0);
  }
  reader.join();
  ASSERT_EQ(received.size(), static_cast<size_t>(kPackets));
  for (int i = 0; i < kPackets; ++i) EXPECT_EQ(received[static_cast<size_t>(i)], i);
}

TEST(KplReply, A_requester_that_never_reads_is_given_up_once) {
  Datagram requester;
  kplhdr* header = begin(requester.address());
  int sent = 0;
  while (reply(header, KPL_CONT_STATUS) == 0 && sent < 100000) ++sent;
  EXPECT_EQ(errno, ETIMEDOUT);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(reply(header, KPL_CONT_STATUS), -1);  // 1000 waits would end the test
  EXPECT_EQ(reply(header, KPL_CONT_END), -1);
}

/// A master that answers one question with the given packets.
class Master {
 public:
  using Packets = std::vector<std::pair<int, std::string>>;  // continuation, body

  explicit Master(Packets packets) : packets_(std::move(packets)), thread_([this] { serve(); }) {
    setenv(KPL_MASTER_ENV, ("@" + socket_.name()).c_str(), 1);
  }
  ~Master() {
    thread_.join();
    unsetenv(KPL_MASTER_ENV);
  }
  const std::string& question() const { return question_; }

 private:
  void serve() {
    question_ = socket_.receive();
    if (question_.size() < sizeof(kplhdr)) return;
    kplhdr* header = kplrrqs(question_.data());
    for (const auto& [cont, body] : packets_) reply(header, cont, body);
  }

  Packets packets_;
  Datagram socket_;
  std::string question_;
  std::thread thread_;
};

std::string lines(const std::vector<std::string>& margins) {
  std::string bytes;
  for (const std::string& margin : margins) {
    statcode record = {};
    margin.copy(record.objname, sizeof record.objname - 1);
    bytes.append(reinterpret_cast<const char*>(&record), sizeof record);
  }
  return bytes;
}

std::string result(short code) {
  svrreply body = {};
  body.rtncode = code;
  return std::string(reinterpret_cast<const char*>(&body), 101);
}

/// All margins that a query gives, two lines a call; *code becomes the last result.
std::vector<std::string> query(int* code, const char* subsystem = "") {
  std::vector<std::string> margins;
  char host[] = "";
  std::string name = subsystem;
  int cont = KPL_CONT_FIRST;
  do {
    char bytes[sizeof(kplhdr) + 2 * sizeof(statcode)];
    short length = sizeof bytes;
    *code = kplstat(host, name.data(), 4711, &length, bytes, &cont);
    if (*code != 0) break;
    for (int at = sizeof(kplhdr); at < length; at += sizeof(statcode)) {
      statcode record;
      memcpy(&record, bytes + at, sizeof record);
      margins.emplace_back(record.objname);
    }
  } while (cont != KPL_CONT_END);
  return margins;
}

TEST(KplShortStatus, Lines_come_in_the_callers_portions) {
  int code;
  {
    Master master({{KPL_CONT_STATUS, lines({"a", "b", "c"})},
                   {KPL_CONT_MESSAGE, result(0)},
                   {KPL_CONT_STATUS, lines({"d", "e"})},
                   {KPL_CONT_END, result(0)}});
    EXPECT_THAT(query(&code, "subsys"), ElementsAre("a", "b", "c", "d", "e"));
    EXPECT_EQ(code, 0);
    ASSERT_EQ(master.question().size(), 160u);
    kplreq asked;
    memcpy(&asked.kplhdr, master.question().data(), 156);
    EXPECT_EQ(asked.subreq.object, 17);
    EXPECT_EQ(asked.subreq.action, 2);
    EXPECT_EQ(asked.subreq.parm1, 0);
    EXPECT_STREQ(asked.subreq.objname, "subsys");
    EXPECT_EQ(static_cast<unsigned char>(master.question()[156]) + 256 * master.question()[157], 4711);
  }
  Master empty({{KPL_CONT_END, result(0)}});
  EXPECT_THAT(query(&code), ElementsAre());
  EXPECT_EQ(code, 0);
}

TEST(KplShortStatus, Failures_are_told_apart) {
  int code;
  {
    Master refuses({{KPL_CONT_STATUS, lines({"a"})}, {KPL_CONT_END, result(KPL_RC_BAD_REQUEST)}});
    query(&code);
    EXPECT_EQ(code, KPL_RC_BAD_REQUEST);
  }
  {
    Master garbles({{KPL_CONT_STATUS, lines({"a"}) + "half"}});
    query(&code);
    EXPECT_EQ(code, -1);
    EXPECT_EQ(errno, EBADMSG);
  }
  setenv(KPL_MASTER_ENV, "/nowhere/at/all", 1);
  query(&code);
  EXPECT_EQ(code, -1);
  EXPECT_EQ(errno, ENOENT);
  unsetenv(KPL_MASTER_ENV);

  short length = sizeof(statrep);
  char bytes[sizeof(statrep)];
  char elsewhere[] = "elsewhere";
  int cont = KPL_CONT_FIRST;
  EXPECT_EQ(kplstat(elsewhere, nullptr, 1, &length, bytes, &cont), -1);
  EXPECT_EQ(errno, EINVAL);
  cont = KPL_CONT_STATUS;  // goes on with a query that was never begun
  EXPECT_EQ(kplstat(nullptr, nullptr, 1, &length, bytes, &cont), -1);
  EXPECT_EQ(errno, EINVAL);
}

}  // namespace
