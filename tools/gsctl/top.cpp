// gsctl top: groups, members, and what they wait for, live on a full screen.
#include <poll.h>
#include <unistd.h>

#include <csignal>

#include "common/command_line.h"
#include "tools/gsctl/screen.h"
#include "tools/gsctl/session.h"
#include "tools/gsctl/top_view.h"

namespace gsctl {
namespace {

constexpr auto kRepaint = std::chrono::seconds(1);  // where nothing is told: how long that has been so
constexpr int kBySignal = 128;                      // an exit status, as in shells

bool hung_up() {
  pollfd input{STDIN_FILENO, POLLIN, 0};
  return poll(&input, 1, 0) > 0 && (input.revents & (POLLHUP | POLLERR)) != 0;
}

class Top {
 public:
  explicit Top(double interval)
      : source_(loop_, interval,
                {[this] { return view_.wanted(); },
                 [this](Snapshot snapshot) {
                   view_.told(std::move(snapshot));
                   show();
                 },
                 [this](const std::string& why) {
                   view_.lost(why + ": tries again");
                   show();
                 }}) {}

  int run(const Settings& settings) {
    const auto limit = end_in_time(loop_, settings, "shown for as long as --timeout says");
    int signal = 0;
    const auto interrupted = on_interrupt(loop_, [&](int number) {
      signal = number;
      loop_.stop();
    });
    const auto resized = loop_.on_signal(SIGWINCH, [this] {
      screen_->fit();
      show();
    });
    screen_.emplace();
    if (screen_->width() < TopView::kLeastWidth || screen_->height() < TopView::kLeastHeight) {
      throw Error(kRefused, "the terminal is too small: make it " + std::to_string(TopView::kLeastWidth) + " x " +
                                std::to_string(TopView::kLeastHeight) + " or larger");
    }
    const auto keys = loop_.on_readable(STDIN_FILENO, [this] { take_keys(); });
    repaint();
    loop_.run();
    return signal == 0 || signal == SIGINT ? kDone : kBySignal + signal;
  }

 private:
  void show() {
    if (screen_) screen_->show(view_.lines(screen_->width(), screen_->height()));
  }

  void repaint() {
    show();
    time_ = loop_.after(kRepaint, [this] { repaint(); });
  }

  void take_keys() {
    if (hung_up()) return loop_.stop();
    while (const auto key = screen_->key()) {
      if (!view_.key(*key)) return loop_.stop();
      source_.ask_now();
    }
    show();
  }

  Loop loop_;
  TopView view_;
  std::optional<Screen> screen_;
  TopSource source_;
  Loop::Handle time_;
};

}  // namespace

Run add_top(CLI::App& command) {
  constexpr double kShortest = 0.05;
  constexpr double kLongest = 3600;
  auto interval = std::make_shared<double>(1);
  command.add_option("--interval", *interval, "Between two looks")
      ->capture_default_str()
      ->type_name("SECONDS")
      ->check(platform::between(kShortest, kLongest));
  return [interval](const Settings& settings) {
    if (settings.json) throw Error(kWrongUse, "top is for people: gsctl groups --watch --json is for scripts");
    return Top(*interval).run(settings);
  };
}

}  // namespace gsctl
