// How kplctl and kplmstr talk: packets over the master's control socket (local, SOCK_SEQPACKET), one message in
// JSON to a packet. A connection carries any number of requests, one after the other. Each is answered by any
// number of interim answers and one End.
//
//   -> {"action":"trace","subsystem":"gsd","on":true,"long":false}
//   <- {"wait":10}                                     the next packet comes within so many seconds
//   <- {"message":"tracing to /var/log/gsd.trace"}     text for the requester
//   <- {"lines":[["margin","body"],...]}               lines of status
//   <- {"entry":{"name":"gsd","state":"active",...}}   one subsystem, answering status and list
//   <- {"end":"ok","code":0,"text":""}                 the last one
#pragma once

#include <nlohmann/json.hpp>
#include <stdexcept>
#include <string>
#include <variant>
#include <vector>

namespace kpl::control {

inline constexpr const char* kDefaultSocketPath = "/run/kplmstr/control";
inline constexpr std::size_t kMaxPacket = 64 * 1024;  // bytes; longer packets are malformed
inline constexpr int kPatience = 5;                   // seconds by which a packet may be late
inline constexpr std::size_t kMaxData = 1836;         // bytes of data that a subsystem's own request may carry

enum class Action { kStart, kStop, kStatus, kTrace, kRefresh, kRequest, kList };
enum class StopKind {
  kNormal,
  kForced,
  kCancel,  // SIGTERM, and SIGKILL when that does not end it
};

struct Request {
  Action action = Action::kList;
  std::string subsystem;  // empty: all of them, for short status and list only
  StopKind stop = StopKind::kNormal;
  bool long_form = false;  // long status, long trace
  bool on = false;         // trace
  int code = 0;            // of the subsystem's own request, 256 to 32767
  int parm1 = 0;
  int parm2 = 0;
  std::string data;
};

/// How a request ended. The values are kplctl's exit statuses.
enum class Result {
  kOk = 0,
  kFailed = 1,        // the subsystem or the master reported an error; the text says which
  kNotReached = 3,    // no master, or not permitted to ask it
  kWrongState = 4,    // no such subsystem, or it is not in the state that the request needs
  kNoAnswer = 5,      // not within its time
  kNotSupported = 6,  // the subsystem does not serve that
};

/// A line of status: margin column and body.
struct Line {
  std::string margin;
  std::string body;
};

struct Wait {
  double seconds = 0;
};
struct Message {
  std::string text;
};
struct Lines {
  std::vector<Line> lines;
};
struct Entry {
  nlohmann::json subsystem;
};
struct End {
  Result result = Result::kOk;
  int code = 0;  // the subsystem's result code, where it gave one
  std::string text;
};
using Answer = std::variant<Wait, Message, Lines, Entry, End>;

/// The packet is not what it should be; says why.
class Malformed : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

/// Text that is no UTF-8 is replaced in answers. `encode` of a request throws Malformed for it.
std::string encode(const Request& request);
std::string encode(const Answer& answer);
/// Throw Malformed. Any bytes may be given; unknown members are ignored.
Request decode_request(const std::string& packet);
Answer decode_answer(const std::string& packet);

/// "ok", "failed", ...: as in End.
const char* name_of(Result result);

}  // namespace kpl::control
