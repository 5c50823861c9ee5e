#include "fake_kpl.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>

namespace fake_kpl {

std::string sent;
std::vector<std::string> replies;
std::vector<ShortStatus> short_status;

namespace {

kplhdr quoted_header;

std::string status_text(const std::string& packet) {
  std::string text;
  for (size_t at = 0; at < packet.size(); at += sizeof(statcode)) {
    statcode record;
    memcpy(&record, packet.data() + at, sizeof record);
    text += std::string(record.objname) + "|" + record.objtext + ";";
  }
  return "[" + text + "]";
}

std::string message_text(const std::string& packet) {
  const std::string text = packet.c_str() + offsetof(svrreply, rtnmsg);
  EXPECT_EQ(packet.substr(offsetof(svrreply, rtnmsg)), text + std::string(2, '\0'));
  return "(" + text + ")";
}

}  // namespace

void reset() {
  sent.clear();
  replies.clear();
}

}  // namespace fake_kpl

using namespace fake_kpl;

kplhdr* kplrrqs(char* request_header) {
  memcpy(&quoted_header, request_header, sizeof quoted_header);
  return &quoted_header;
}

int kplsrpy(kplhdr* header, char* reply, int reply_len, int cont) {
  EXPECT_EQ(header, &quoted_header);
  const std::string packet(reply + sizeof(kplhdr), reply + reply_len);
  if (cont == KPL_CONT_END) replies.push_back(packet);
  if (cont != KPL_CONT_END) sent += cont == KPL_CONT_STATUS ? status_text(packet) : message_text(packet);
  errno = ENOTCONN;  // whatever happens here is not to be seen outside
  return -1;
}

int kplstat(char* host, char* subsystem, pid_t, short* reply_len, char* reply, int* cont) {
  EXPECT_STREQ(host, "");
  EXPECT_STREQ(subsystem, "");
  EXPECT_EQ(*reply_len, 318);
  errno = EIO;
  if (short_status.empty()) return -1;
  const ShortStatus answer = short_status.front();
  short_status.erase(short_status.begin());
  *reply_len = sizeof(kplhdr);
  for (const auto& [margin, body] : answer.lines) {
    statcode record = {};
    margin.copy(record.objname, sizeof record.objname);  // may fill the field
    body.copy(record.objtext, sizeof record.objtext);
    memcpy(reply + *reply_len, &record, sizeof record);
    *reply_len = static_cast<short>(*reply_len + sizeof record);
  }
  *cont = short_status.empty() ? KPL_CONT_END : KPL_CONT_STATUS;
  return answer.result;
}
