#include "master/channel.h"

#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstring>

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr std::size_t kTypeSize = offsetof(kplreq, kplhdr);

class SocketChannel : public Channel {
 public:
  SocketChannel() {
    std::array<int, 2> ends{};
    if (socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
      throw ChannelError(std::string("cannot make the request socket: ") + strerror(errno));
    }
    own_ = Descriptor(ends[0]);
    subsystem_ = Descriptor(ends[1]);
  }
  int subsystem_end() const override { return subsystem_.get(); }
  void forget_subsystem_end() override { subsystem_ = Descriptor(); }

  Sent send(const kplreq& request, const std::string& data) override {
    const char* bytes = reinterpret_cast<const char*>(&request);
    iovec parts[] = {{const_cast<char*>(bytes + kTypeSize), sizeof request - kTypeSize},
                     {const_cast<char*>(data.data()), data.size()}};
    msghdr message{};
    message.msg_iov = parts;
    message.msg_iovlen = 2;
    ssize_t sent = 0;
    do {
      sent = sendmsg(own_.get(), &message, MSG_DONTWAIT | MSG_NOSIGNAL);
    } while (sent < 0 && errno == EINTR);
    if (sent >= 0) return Sent::kDone;
    return errno == EAGAIN || errno == ENOBUFS ? Sent::kFull : Sent::kGone;
  }

 private:
  Descriptor own_;
  Descriptor subsystem_;
};

/// The queue is made for the run and goes with it.
class QueueChannel : public Channel {
 public:
  QueueChannel(int key, int type) : type_(type) {
    queue_ = msgget(key, IPC_CREAT | IPC_EXCL | kMode);
    if (queue_ < 0 && errno == EEXIST) queue_ = take_over(key);
    if (queue_ < 0) throw ChannelError("cannot make the message queue " + name(key) + ": " + strerror(errno));
  }
  ~QueueChannel() override { msgctl(queue_, IPC_RMID, nullptr); }
  QueueChannel(const QueueChannel&) = delete;
  QueueChannel& operator=(const QueueChannel&) = delete;

  Sent send(const kplreq& request, const std::string& data) override {
    const long type = type_;
    std::string message(reinterpret_cast<const char*>(&type), sizeof type);
    message.append(reinterpret_cast<const char*>(&request) + kTypeSize, sizeof request - kTypeSize);
    message.append(data);
    int result = 0;
    do {
      result = msgsnd(queue_, message.data(), message.size() - kTypeSize, IPC_NOWAIT);
    } while (result != 0 && errno == EINTR);
    if (result == 0) return Sent::kDone;
    return errno == EAGAIN ? Sent::kFull : Sent::kGone;
  }

 private:
  static constexpr int kMode = 0660;  // the subsystem's effective user or group is 0

  static std::string name(int key) { return "with key " + std::to_string(key); }

  /// A queue of this key may be what an earlier master left behind when it was killed; it is anew then. Anybody
  /// else's queue is left alone.
  static int take_over(int key) {
    const int found = msgget(key, 0);
    msqid_ds state{};
    if (found < 0 || msgctl(found, IPC_STAT, &state) != 0) return -1;
    if (state.msg_perm.cuid != 0 || state.msg_perm.uid != 0 || (state.msg_perm.mode & 0777) != kMode) {
      throw ChannelError("the message queue " + name(key) + " is in use by user " +
                         std::to_string(state.msg_perm.cuid));
    }
    if (msgctl(found, IPC_RMID, nullptr) != 0) return -1;
    return msgget(key, IPC_CREAT | IPC_EXCL | kMode);
  }

  const int type_;
  int queue_ = -1;
};

}  // namespace

std::unique_ptr<Channel> open_channel(const Definition& definition) {
  switch (definition.transport) {
    case Transport::kSocket:
      return std::make_unique<SocketChannel>();
    case Transport::kQueue:
      return std::make_unique<QueueChannel>(definition.queue_key, definition.queue_type);
    case Transport::kSignals:
      break;
  }
  return nullptr;
}

}  // namespace kpl::master
