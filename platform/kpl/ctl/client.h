// A connection to the master.
#pragma once

#include <functional>
#include <string>

#include "common/descriptor.h"
#include "control/control.h"

namespace kpl::ctl {

class Client {
 public:
  using Interim = std::function<void(const control::Answer&)>;

  /// Connects at the first request.
  explicit Client(std::string socket_path) : path_(std::move(socket_path)) {}

  /// Waits for the end of the request; `interim` is told what comes before. A master that cannot be asked, does
  /// not answer in time, or makes no sense, ends it too. Throws control::Malformed for what cannot be sent.
  control::End ask(const control::Request& request, const Interim& interim);

 private:
  bool connect_to_master();
  /// *ended: the master has said so.
  control::End exchange(const std::string& question, const Interim& interim, bool* ended);
  control::End not_reached() const;

  const std::string path_;
  platform::Descriptor socket_;
};

}  // namespace kpl::ctl
