// terminal COLUMNSxROWS COMMAND...: runs the command in a terminal and does, line by line, what standard input
// says:
//
//   expect TEXT   waits until the screen shows it          gone TEXT   until it shows it no more
//   keys TEXT     types it; \e, \r and \t as in C          size CxR    makes the terminal another size
//   signal N      to the command                           lines N     the screen has so many that are not empty
//   touch FILE    makes one: so far has it come
//   end STATUS    waits for the command's end with this status (128 + N: by signal N), and sees to it that the
//                 terminal is as it was: its modes, and what its screen showed before
//
// Ends with status 1 and the screen on standard error where it is not so.
#include <poll.h>
#include <pty.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/wait.h>
#include <termios.h>
#include <unistd.h>
#include <utmp.h>
#include <vterm.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <iostream>
#include <sstream>
#include <string>
#include <vector>

namespace {

constexpr auto kPatience = std::chrono::seconds(60);  // a bound on a hang
constexpr char kBefore[] = "what was here before\r\n";

struct Wrong {
  std::string what;
};

struct Size {
  int columns = 0, rows = 0;
};

Size size_of(const std::string& text) {
  Size size;
  char by = 0;
  std::istringstream(text) >> size.columns >> by >> size.rows;
  return size;
}

std::string unescaped(const std::string& text) {
  std::string keys;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '\\' || i + 1 == text.size()) {
      keys += text[i];
      continue;
    }
    const char c = text[++i];
    keys += c == 'e' ? '\033' : (c == 'r' ? '\r' : '\t');
  }
  return keys;
}

class Terminal {
 public:
  Terminal(Size size, char** command)
      : vt_(vterm_new(size.rows, size.columns)), screen_(vterm_obtain_screen(vt_)) {
    vterm_set_utf8(vt_, 1);
    vterm_screen_enable_altscreen(screen_, 1);
    vterm_screen_reset(screen_, 1);
    vterm_input_write(vt_, kBefore, std::strlen(kBefore));
    winsize window{};
    window.ws_col = static_cast<unsigned short>(size.columns);
    window.ws_row = static_cast<unsigned short>(size.rows);
    if (openpty(&master_, &slave_, nullptr, nullptr, &window) != 0) throw Wrong{"no terminal to be had"};
    tcgetattr(slave_, &modes_);
    child_ = fork();
    if (child_ != 0) return;
    login_tty(dup(slave_));
    execvp(command[0], command);
    _exit(127);
  }
  ~Terminal() {
    if (child_ > 0) kill(child_, SIGKILL);
    vterm_free(vt_);
  }

  void obey(const std::string& line) {
    const std::size_t blank = line.find(' ');
    const std::string verb = line.substr(0, blank);
    const std::string rest = blank == std::string::npos ? "" : line.substr(blank + 1);
    if (verb == "expect") return until(line, [&] { return text().find(rest) != std::string::npos; });
    if (verb == "gone") return until(line, [&] { return text().find(rest) == std::string::npos; });
    if (verb == "lines") return until(line, [&] { return std::to_string(filled()) == rest; });
    if (verb == "keys") return type(unescaped(rest));
    if (verb == "size") return resize(size_of(rest));
    if (verb == "signal") return void(kill(child_, std::stoi(rest)));
    if (verb == "touch") return void(std::ofstream(rest));
    if (verb == "end") return end(std::stoi(rest));
    throw Wrong{"unknown: " + line};
  }

  std::string text() const {
    Size size;
    vterm_get_size(vt_, &size.rows, &size.columns);
    std::string all;
    for (int row = 0; row < size.rows; ++row) {
      std::string line(static_cast<std::size_t>(size.columns) * 4, ' ');
      const std::size_t length =
          vterm_screen_get_text(screen_, line.data(), line.size(), VTermRect{row, row + 1, 0, size.columns});
      line.resize(length);
      all += line.erase(line.find_last_not_of(' ') + 1) + "\n";
    }
    return all;
  }

 private:
  template <typename Condition>
  void until(const std::string& what, Condition condition) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!condition()) {
      if (std::chrono::steady_clock::now() > deadline) throw Wrong{"waited in vain: " + what};
      take();
    }
  }

  int filled() const {
    std::istringstream lines(text());
    int count = 0;
    for (std::string line; std::getline(lines, line);) count += line.empty() ? 0 : 1;
    return count;
  }

  void take() {
    char bytes[4096];
    pollfd output{master_, POLLIN, 0};
    if (poll(&output, 1, 50) <= 0) return;
    const ssize_t length = read(master_, bytes, sizeof bytes);
    if (length > 0) vterm_input_write(vt_, bytes, static_cast<std::size_t>(length));
  }

  void type(const std::string& keys) {
    if (write(master_, keys.data(), keys.size()) < 0) throw Wrong{"cannot type"};
  }

  void resize(Size size) {
    winsize window{};
    window.ws_col = static_cast<unsigned short>(size.columns);
    window.ws_row = static_cast<unsigned short>(size.rows);
    vterm_set_size(vt_, size.rows, size.columns);
    ioctl(master_, TIOCSWINSZ, &window);  // tells the foreground process group
  }

  void end(int wanted) {
    int status = 0;
    until("end", [&] { return waitpid(child_, &status, WNOHANG) == child_; });
    child_ = -1;
    const int got = WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
    if (got != wanted) throw Wrong{"ended with status " + std::to_string(got)};
    until("the screen from before", [&] { return text().find("what was here before") != std::string::npos; });
    termios now{};
    tcgetattr(slave_, &now);
    const bool same =
        now.c_lflag == modes_.c_lflag && now.c_iflag == modes_.c_iflag && now.c_oflag == modes_.c_oflag;
    if (!same) throw Wrong{"the terminal has other modes than before"};
  }

  VTerm* vt_;
  VTermScreen* screen_;
  int master_ = -1, slave_ = -1;
  termios modes_{};
  pid_t child_ = -1;
};

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) return 2;
  setenv("TERM", "xterm", 1);
  try {
    Terminal terminal(size_of(argv[1]), argv + 2);
    try {
      for (std::string line; std::getline(std::cin, line);) terminal.obey(line);
    } catch (const Wrong& wrong) {
      std::cerr << wrong.what << "; the screen:\n" << terminal.text();
      return 1;
    }
  } catch (const Wrong& wrong) {
    std::cerr << wrong.what << "\n";
    return 1;
  }
  return 0;
}
