#include "tools/gsctl/screen.h"

#define NCURSES_NOMACROS  // else common words are macros
#include <langinfo.h>
#include <ncurses.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <clocale>
#include <cstdlib>
#include <cstring>
#include <cwchar>

#include "tools/gsctl/status.h"

namespace gsctl {
namespace {

constexpr int kEscapeKey = 27;
constexpr int kEscapePatience = 25;  // milliseconds from an escape to the rest of a key's sequence

/// So much of the text as goes into the columns; wide characters take two.
std::string cut(const std::string& text, int columns) {
  std::mbstate_t state{};
  std::size_t at = 0;
  while (at < text.size()) {
    wchar_t character = 0;
    const std::size_t length = std::mbrtowc(&character, text.data() + at, text.size() - at, &state);
    if (length == 0 || length > text.size()) break;
    columns -= std::max(wcwidth(character), 0);
    if (columns < 0) break;
    at += length;
  }
  return text.substr(0, at);
}

/// For a terminal of another character set.
std::string ascii(std::string text) {
  std::string shown;
  for (const char c : text) {
    const bool goes_on = (static_cast<unsigned char>(c) & 0xC0) == 0x80;
    if (!goes_on) shown += static_cast<unsigned char>(c) < 0x80 ? c : '?';
  }
  return shown;
}

Key key_of(int code) {
  using Kind = Key::Kind;
  switch (code) {
    case KEY_UP:
      return {Kind::kUp};
    case KEY_DOWN:
      return {Kind::kDown};
    case KEY_PPAGE:
      return {Kind::kPageUp};
    case KEY_NPAGE:
      return {Kind::kPageDown};
    case KEY_HOME:
      return {Kind::kHome};
    case KEY_END:
      return {Kind::kEnd};
    case KEY_ENTER:
    case '\r':
    case '\n':
      return {Kind::kEnter};
    case KEY_BACKSPACE:
    case '\b':
    case 127:
      return {Kind::kErase};
    case '\t':
      return {Kind::kTab};
    case kEscapeKey:
      return {Kind::kEscape};
    default:
      if (code < ' ' || code > '~') return {Kind::kOther};
      return {Kind::kCharacter, static_cast<char>(code)};
  }
}

}  // namespace

struct Screen::Terminal {
  SCREEN* screen = nullptr;
  bool utf8 = false;
};

Screen::Screen() : terminal_(std::make_unique<Terminal>()) {
  if (isatty(STDIN_FILENO) == 0 || isatty(STDOUT_FILENO) == 0) {
    throw Error(kRefused, "a terminal is needed: gsctl groups --watch does without");
  }
  std::setlocale(LC_CTYPE, "");
  terminal_->utf8 = std::strcmp(nl_langinfo(CODESET), "UTF-8") == 0;
  terminal_->screen = newterm(nullptr, stdout, stdin);
  if (terminal_->screen == nullptr) {
    const char* type = getenv("TERM");
    throw Error(kRefused, std::string("the terminal '") + (type ? type : "") + "' is not known: set TERM");
  }
  set_escdelay(kEscapePatience);
  cbreak();
  noecho();
  nonl();
  keypad(stdscr, TRUE);
  nodelay(stdscr, TRUE);
  curs_set(0);
}

Screen::~Screen() {
  endwin();
  delscreen(terminal_->screen);
}

int Screen::width() const { return COLS; }
int Screen::height() const { return LINES; }

void Screen::fit() {
  winsize size{};
  if (ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_row > 0 && size.ws_col > 0) {
    resizeterm(size.ws_row, size.ws_col);
  }
  clear();
}

void Screen::show(const std::vector<ScreenLine>& lines) {
  erase();
  for (int row = 0; row < std::min<int>(LINES, static_cast<int>(lines.size())); ++row) {
    const ScreenLine& line = lines[static_cast<std::size_t>(row)];
    const attr_t look = line.look == ScreenLine::Look::kBold      ? A_BOLD
                        : line.look == ScreenLine::Look::kReverse ? A_REVERSE
                                                                  : A_NORMAL;
    attrset(static_cast<int>(look));
    if (line.look == ScreenLine::Look::kReverse) mvhline(row, 0, ' ' | look, COLS);
    mvaddstr(row, 0, cut(terminal_->utf8 ? line.text : ascii(line.text), COLS).c_str());
  }
  attrset(A_NORMAL);
  refresh();
}

std::optional<Key> Screen::key() {
  const int code = getch();
  if (code == ERR) return std::nullopt;
  return key_of(code);
}

}  // namespace gsctl
