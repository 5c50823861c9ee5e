#include "fake_kpl.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>

namespace fake_kpl {

std::vector<Packet> packets;
kplhdr* quoted_header = nullptr;
std::vector<ShortStatus> short_status;

namespace {
kplhdr header;
}

void reset() {
  packets.clear();
  short_status.clear();
}

std::vector<Line> status_lines() {
  std::vector<Line> lines;
  for (const Packet& packet : packets) {
    if (packet.cont != KPL_CONT_STATUS) continue;
    for (size_t at = sizeof(kplhdr); at < packet.bytes.size(); at += sizeof(statcode)) {
      statcode record;
      memcpy(&record, packet.bytes.data() + at, sizeof record);
      lines.push_back({record.objname, record.objtext});
    }
  }
  return lines;
}

std::vector<size_t> status_packet_sizes() {
  std::vector<size_t> sizes;
  for (const Packet& packet : packets) {
    if (packet.cont == KPL_CONT_STATUS) sizes.push_back((packet.bytes.size() - sizeof(kplhdr)) / sizeof(statcode));
  }
  return sizes;
}

std::vector<std::string> messages() {
  std::vector<std::string> texts;
  for (const Packet& packet : packets) {
    if (packet.cont != KPL_CONT_MESSAGE) continue;
    const std::string text = packet.bytes.data() + offsetof(kplrep, svrreply) + offsetof(svrreply, rtnmsg);
    EXPECT_EQ(packet.bytes.size(), 219 + text.size());
    texts.push_back(text);
  }
  return texts;
}

}  // namespace fake_kpl

kplhdr* kplrrqs(char* request_header) {
  memcpy(&fake_kpl::header, request_header, sizeof fake_kpl::header);
  return fake_kpl::quoted_header = &fake_kpl::header;
}

int kplsrpy(kplhdr* header, char* reply, int reply_len, int cont) {
  EXPECT_EQ(header, fake_kpl::quoted_header);
  fake_kpl::packets.push_back({cont, std::string(reply, static_cast<size_t>(reply_len))});
  errno = ENOTCONN;  // whatever happens here is not to be seen outside
  return -1;
}

int kplstat(char* host, char* subsystem, pid_t, short* reply_len, char* reply, int* cont) {
  EXPECT_STREQ(host, "");
  EXPECT_STREQ(subsystem, "");
  EXPECT_EQ(*reply_len, 318);
  errno = EIO;
  if (fake_kpl::short_status.empty()) return -1;
  const fake_kpl::ShortStatus answer = fake_kpl::short_status.front();
  fake_kpl::short_status.erase(fake_kpl::short_status.begin());
  memset(reply, 0, static_cast<size_t>(*reply_len));
  for (size_t i = 0; i < answer.lines.size(); ++i) {
    statcode record = {};
    answer.lines[i].margin.copy(record.objname, sizeof record.objname);  // may fill the field
    answer.lines[i].body.copy(record.objtext, sizeof record.objtext);
    memcpy(reply + sizeof(kplhdr) + i * sizeof record, &record, sizeof record);
  }
  *reply_len = static_cast<short>(sizeof(kplhdr) + answer.lines.size() * sizeof(statcode));
  *cont = fake_kpl::short_status.empty() ? 0 : 2;
  return answer.result;
}
