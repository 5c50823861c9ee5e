// The KPL library itself: where replies go, and asking a master for short status.
#include "kpl.h"

#include <errno.h>
#include <stdlib.h>

#include <filesystem>
#include <thread>
#include <vector>

#include "../support/temp_dir.h"
#include "datagram.h"

namespace {

using testing::ElementsAre;

size_t open_descriptors() {
  const std::filesystem::directory_iterator entries("/proc/self/fd");
  return static_cast<size_t>(std::distance(begin(entries), end(entries)));
}

/// Begins the answer to a request with that return address.
kplhdr* begin_answer(const sockaddr_un& retaddr) {
  char request[1 + sizeof(kplhdr)];  // requests lie in their buffer at any alignment
  kplhdr header = {};
  header.retaddr = retaddr;
  header.dversion = 5;
  memcpy(request + 1, &header, sizeof header);
  return kplrrqs(request + 1);
}

int reply(kplhdr* header, int cont, const std::string& body = "") {
  const std::string own(sizeof(kplhdr), '#');
  std::string bytes = own + body;
  const int result = kplsrpy(header, bytes.data(), static_cast<int>(bytes.size()), cont);
  EXPECT_EQ(bytes, own + body);  // the caller's stays as it is
  return result;
}

sockaddr_un address_of(const std::string& path) {
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path);
  return address;
}

TEST(KplReply, Packets_arrive_in_order_with_the_requests_header) {
  const Datagram requester;
  std::vector<std::string> received(300);  // far more than a socket's queue takes
  std::thread reader([&] {
    for (std::string& packet : received) {
      if ((packet = requester.receive()).empty()) break;
    }
  });
  const size_t before = open_descriptors();
  kplhdr* header = begin_answer(requester.address());
  const auto cont = [&](size_t i) { return i == received.size() - 1 ? KPL_CONT_END : KPL_CONT_STATUS; };
  for (size_t i = 0; i < received.size(); ++i) EXPECT_EQ(reply(header, cont(i), std::to_string(i)), 0);
  EXPECT_EQ(open_descriptors(), before);
  reader.join();
  for (size_t i = 0; i < received.size(); ++i) {
    ASSERT_EQ(received[i].substr(sizeof(kplhdr)), std::to_string(i));
    kplhdr sent = {requester.address(), {}, 5, static_cast<short>(cont(i))};
    EXPECT_EQ(memcmp(received[i].data(), &sent, sizeof sent), 0);
  }
}

TEST(KplReply, Requesters_that_nobody_is_cost_nothing) {
  const size_t before = open_descriptors();
  const sockaddr_un gone = Datagram().address();
  const auto error_of = [](const sockaddr_un& address) {
    kplhdr* header = begin_answer(address);
    EXPECT_EQ(reply(header, KPL_CONT_STATUS), -1);
    const int error = errno;
    EXPECT_EQ(reply(header, KPL_CONT_END), -1);
    return error;
  };
  EXPECT_EQ(error_of(gone), ECONNREFUSED);
  EXPECT_EQ(error_of({}), EDESTADDRREQ);
  EXPECT_EQ(error_of(address_of("")), EDESTADDRREQ);
  const test_support::TempDir dir;  // a path is not answered, whoever listens there
  const sockaddr_un path = address_of(dir / "x");
  const int listening = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  EXPECT_EQ(bind(listening, reinterpret_cast<const sockaddr*>(&path), sizeof path), 0);
  EXPECT_EQ(error_of(path), EDESTADDRREQ);
  close(listening);
  char packet[sizeof(kplhdr)] = {};
  EXPECT_EQ(kplsrpy(begin_answer({}), packet, sizeof packet - 1, KPL_CONT_END), -1);
  EXPECT_EQ(errno, EINVAL);

  const Datagram there;  // the ones before are forgotten
  EXPECT_EQ(reply(begin_answer(there.address()), KPL_CONT_END), 0);
  EXPECT_EQ(open_descriptors(), before + 1);
}

TEST(KplReply, A_requester_that_never_reads_is_given_up_once) {
  const Datagram requester;
  kplhdr* header = begin_answer(requester.address());
  int sent = 0;
  while (reply(header, KPL_CONT_STATUS) == 0 && sent < 100000) ++sent;
  EXPECT_EQ(errno, ETIMEDOUT);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(reply(header, KPL_CONT_STATUS), -1);  // 1000 waits would end the test
  EXPECT_EQ(reply(header, KPL_CONT_END), -1);
}

/// A master that answers one question with the given packets: continuation and body.
class Master {
 public:
  explicit Master(std::vector<std::pair<int, std::string>> packets) {
    sockaddr_un own = {};
    own.sun_family = AF_UNIX;
    socklen_t length = sizeof own;
    auto* address = reinterpret_cast<sockaddr*>(&own);
    bind(listening_, address, sizeof own.sun_family);
    getsockname(listening_, address, &length);
    listen(listening_, 1);
    setenv(KPL_MASTER_ENV, ("@" + std::string(own.sun_path + 1)).c_str(), 1);
    thread_ = std::thread([this, packets] { serve(packets); });
  }
  ~Master() {
    thread_.join();
    close(listening_);
  }

  std::string question;

 private:
  void serve(const std::vector<std::pair<int, std::string>>& packets) {
    pollfd entry = {listening_, POLLIN, 0};
    if (poll(&entry, 1, Datagram::kPatienceMs) != 1) return;
    const int asker = accept4(listening_, nullptr, nullptr, SOCK_CLOEXEC);
    std::string received(300, '\0');
    const ssize_t got = recv(asker, received.data(), received.size(), 0);
    received.resize(got > 0 ? static_cast<size_t>(got) : 0);
    question = received;
    for (const auto& [cont, body] : packets) {
      kplhdr header = {};
      header.cont = static_cast<short>(cont);
      std::string packet(reinterpret_cast<const char*>(&header), sizeof header);
      packet += body;
      send(asker, packet.data(), packet.size(), MSG_NOSIGNAL);
    }
    close(asker);
  }

  int listening_ = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  std::thread thread_;
};

std::string lines(const std::string& letters) {
  std::string bytes;
  for (const char letter : letters) {
    const statcode record = {0, 0, "", {letter}};
    bytes.append(reinterpret_cast<const char*>(&record), sizeof record);
  }
  return bytes;
}

std::string result(short code) { return std::string(reinterpret_cast<const char*>(&code), sizeof code); }

/// The first letters of all margins that a query gives, two lines a call, then its result.
std::string query() {
  std::string told;
  char host[] = "";
  char subsystem[] = "subsys";
  int cont = KPL_CONT_FIRST;
  while (cont != KPL_CONT_END) {
    char bytes[sizeof(kplhdr) + 2 * sizeof(statcode)];
    short length = sizeof bytes;
    errno = 0;
    const int code = kplstat(host, subsystem, 4711, &length, bytes, &cont);
    if (code != 0) return told + std::to_string(code) + (code == -1 ? strerrorname_np(errno) : "");
    for (int at = sizeof(kplhdr); at < length; at += sizeof(statcode)) {
      told += bytes[at + static_cast<int>(offsetof(statcode, objname))];
    }
  }
  return told + "0";
}

TEST(KplShortStatus, Lines_come_in_the_callers_portions_and_failures_are_told_apart) {
  {
    const Master master({{KPL_CONT_STATUS, lines("abc")},
                         {KPL_CONT_MESSAGE, "as short as can be"},
                         {KPL_CONT_STATUS, lines("de")},
                         {KPL_CONT_END, result(0)}});
    EXPECT_EQ(query(), "abcde0");
    ASSERT_EQ(master.question.size(), 160U);
    const subreq asked = {17, 2, 0, 0, "subsys"};
    const int pid = 4711;
    EXPECT_EQ(memcmp(master.question.data() + sizeof(kplhdr), &asked, sizeof asked), 0);
    EXPECT_EQ(memcmp(master.question.data() + 156, &pid, sizeof pid), 0);
  }
  const struct {
    std::vector<std::pair<int, std::string>> packets;
    const char* outcome;
  } cases[] = {{{{KPL_CONT_END, result(0)}}, "0"},
               {{{KPL_CONT_STATUS, lines("a")}, {KPL_CONT_END, result(-9087)}}, "-9087"},
               {{{KPL_CONT_STATUS, lines("a") + "half"}}, "-1EBADMSG"},
               {{{KPL_CONT_STATUS, lines("a")}}, "-1ECONNRESET"},
               {{{KPL_CONT_END, "1"}}, "-1EBADMSG"}};
  for (const auto& c : cases) {
    const Master master(c.packets);
    EXPECT_EQ(query(), c.outcome);
  }
  setenv(KPL_MASTER_ENV, "/nowhere/at/all", 1);
  EXPECT_EQ(query(), "-1ENOENT");
  unsetenv(KPL_MASTER_ENV);
}

}  // namespace
