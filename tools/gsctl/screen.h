// The terminal as a full screen of lines, and its keys.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace gsctl {

struct Key {
  enum class Kind {
    kCharacter,
    kUp,
    kDown,
    kPageUp,
    kPageDown,
    kHome,
    kEnd,
    kEnter,
    kEscape,
    kErase,
    kTab,
    kOther
  };
  Kind kind = Kind::kOther;
  char character = 0;  // ASCII, where it is one
};

struct ScreenLine {
  enum class Look { kPlain, kBold, kReverse };
  std::string text;  // printable UTF-8; what is too long is cut
  Look look = Look::kPlain;
};

/// One at a time. The terminal is as it was before once this is gone.
class Screen {
 public:
  /// Throws Error: standard input and output are no terminal, or one that is not known.
  Screen();
  ~Screen();
  Screen(const Screen&) = delete;
  Screen& operator=(const Screen&) = delete;

  int width() const;
  int height() const;
  /// The terminal may have another size.
  void fit();
  /// From the top on; what is below is empty.
  void show(const std::vector<ScreenLine>& lines);
  /// Nothing: no key is there.
  std::optional<Key> key();

 private:
  struct Terminal;
  std::unique_ptr<Terminal> terminal_;
};

}  // namespace gsctl
