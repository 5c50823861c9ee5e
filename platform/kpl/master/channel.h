// How requests reach a subsystem: one channel for each run of it.
#pragma once

#include <memory>
#include <stdexcept>
#include <string>

#include "common/descriptor.h"
#include "kpl.h"
#include "master/definition.h"

namespace kpl::master {

/// Says in one line why there can be no channel.
class ChannelError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

class Channel {
 public:
  enum class Sent {
    kDone,
    kFull,  // the subsystem does not read its requests
    kGone,  // it has closed its end
  };

  virtual ~Channel() = default;
  /// What becomes descriptor 0 of the subsystem; -1: nothing.
  virtual int subsystem_end() const { return -1; }
  /// The subsystem has its end: the master forgets it.
  virtual void forget_subsystem_end() {}
  /// Sends `request` and `data` as one message, without waiting.
  virtual Sent send(const kplreq& request, const std::string& data) = 0;
};

/// A new channel without any old requests in it; null for signals. Throws ChannelError.
std::unique_ptr<Channel> open_channel(const Definition& definition);

}  // namespace kpl::master
