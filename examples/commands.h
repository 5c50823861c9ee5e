// Reads commands from standard input, a line at a time, without ever blocking the loop that also dispatches.
#pragma once

#include <unistd.h>

#include <string>

class Commands {
 public:
  int descriptor() const { return STDIN_FILENO; }

  /// To be called when the descriptor is readable; false at the end of the input.
  bool read_some() {
    char bytes[4096];
    ssize_t count = ::read(STDIN_FILENO, bytes, sizeof bytes);
    if (count <= 0) return false;
    text_.append(bytes, static_cast<size_t>(count));
    return true;
  }

  /// Takes the next whole line; false when there is none yet.
  bool next(std::string* line) {
    size_t end = text_.find('\n');
    if (end == std::string::npos) return false;
    *line = text_.substr(0, end);
    text_.erase(0, end + 1);
    return true;
  }

 private:
  std::string text_;
};
