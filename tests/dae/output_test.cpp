// The output channels: how text becomes lines, lines become records, and when packets go out.
#include <errno.h>
#include <locale.h>
#include <stdlib.h>
#include <unistd.h>

#include <functional>

#include "dae/dae_internal.h"
#include "fake_kpl.h"

namespace {

constexpr auto body = dae_status_puts;
constexpr auto inform = dae_inform_puts;
constexpr auto error = dae_error_puts;
template <int NewWidth = -1>
int margin(const char* text) {
  return dae_margin_puts(NewWidth, text);
}
int flush_status(const char*) { return dae_status_flush(); }
int flush_inform(const char*) { return dae_inform_flush(); }

struct Call {
  int (*put)(const char*);
  std::string text = "";
  int returned = static_cast<int>(text.size());
};
/// Calls, and the packets and the error text that come of them.
struct Case {
  std::vector<Call> calls;
  std::string result;
};

/// Runs text through the channels as if a request were served.
class Output : public testing::Test {
 protected:
  Output() {
    dae_pid__INTERNAL__ = getpid();
    dae_prof__INTERNAL__.KPL_comm = DAE_C_SOCK;
    dae_prof__INTERNAL__.long_status = [] {};
    EXPECT_EQ(dae_output_init__INTERNAL__(), 0);
  }
  ~Output() override {
    setlocale(LC_ALL, "C");
    dae_pid__INTERNAL__ = 0;
  }

  /// The packets sent (see fake_kpl.h), then the error text.
  std::string serve(bool status, const std::function<void()>& routine) {
    char request[sizeof(kplhdr)] = {};
    fake_kpl::reset();
    dae_output_open__INTERNAL__(kplrrqs(request), status);
    routine();
    const char* error_text = nullptr;
    dae_output_close__INTERNAL__(&error_text);
    return fake_kpl::sent + (error_text != nullptr ? error_text : "");
  }

  void check(const std::vector<Case>& cases) {
    for (const auto& [calls, result] : cases) {
      const auto make = [&calls = calls] {
        for (const auto& [put, text, returned] : calls) EXPECT_EQ(put(text.c_str()), returned);
      };
      EXPECT_EQ(serve(true, make), result);
    }
  }
};

std::string x(int count, const std::string& what = "x") {
  std::string text;
  for (int i = 0; i < count; ++i) text += what;
  return text;
}

TEST_F(Output, Status_text_is_broken_into_margin_and_body) {
  check({
      {{{margin<10>, "name"}, {body, "value\nmore\n"}}, "[name      |value;          |more;]"},
      {{{margin<2>, "m\n"}, {margin<40>, "wide\n"}, {body, "7"}}, "[m|;wide|;" + x(29, " ") + "|7;]"},
      // Another width ends the line that waits; behind body text there is no margin left.
      {{{margin<4>, "ab"}, {margin<6>, "cd"}, {margin<6>, "ef"}, {body, "body"}, {margin<>, "gh"}},
       "[ab|;cdef  |body;gh|;]"},
      {{{body, x(100) + "\n"}}, "[|" + x(64) + ";|" + x(36) + ";]"},
      {{{margin<3>, "abcdefgh\n"}, {body, x(64) + "\nz"}}, "[abc|;def|;gh|;   |" + x(64) + ";   |z;]"},
      {{{body, x(60)}, {body, x(4)}, {body, "y\n"}}, "[|" + x(64) + ";|y;]"},
      // Empty lines ride on the record before them; one made of nothing else is itself a line.
      {{{body, "text\n\n\n\n"}}, "[|text\n\n\n;]"},
      {{{body, "\n\n"}}, "[|\n;]"},
      {{{body, x(64) + "\n\nnext"}}, "[|" + x(64) + ";|;|next;]"},
      {{{margin<2>, "\n"}, {body, "\n"}, {margin<>, "m\n\n"}, {margin<0>, "\n"}}, "[|\n;m|\n\n;]"},
      {{{body, x(130, "\n")}}, "[|" + x(63, "\n") + ";|" + x(63, "\n") + ";|\n;]"},
      // A percent sign is never parted from its double.
      {{{body, "50% and 60%\n%"}}, "[|50%% and 60%%;|%%;]"},
      {{{body, x(62) + "%z\n"}}, "[|" + x(62) + "%%;|z;]"},
      {{{body, x(63) + "%z\n"}}, "[|" + x(63) + ";|%%z;]"},
      {{{body, x(64, "%")}}, "[|" + x(64, "%") + ";|" + x(64, "%") + ";]"},
      // No percent sign in margins, and no text in one that has no width, which a refused call does not set.
      {{{margin<8>, "a%", -1}, {margin<>, "\na", -1}, {margin<1>, "a"}}, "[a|;]"},
  });
  if (setlocale(LC_ALL, "C.UTF-8") == nullptr) GTEST_SKIP() << "no locale C.UTF-8";
  check({
      {{{body, x(63) + "€z\n"}}, "[|" + x(63) + ";|€z;]"},
      {{{body, "kept\n"}, {body, x(60) + "\xff" + x(20) + "\n", -1}}, "[|kept;]"},
      {{{margin<2>, "€\n", -1}, {margin<3>, "€\n"}}, "[€|;]"},  // wider than the column
  });
  const auto lines =
      [](const std::string& end) {  // the last one is too long, so that its characters are looked at
        return x(63, x(62) + "\n") + x(62) + x(62) + end;
      };
  EXPECT_EQ(serve(true, [&] { EXPECT_EQ(dae_status_printf("%s€€\n", lines("").c_str()), 4093); }),
            serve(true, [&] { dae_status_puts(lines("").c_str()); }));
}

TEST_F(Output, Packets_go_out_full_and_never_empty) {
  check({
      {{{body, x(200, "a\n")}}, "[" + x(80, "|a;") + "][" + x(80, "|a;") + "][" + x(40, "|a;") + "]"},
      // The 80th line is sent when the next one is needed; what waits for its end goes with a flush.
      {{{body, x(80, "a\n")}, {inform, "i"}, {flush_inform}, {flush_status}, {flush_status}, {body, "b"}},
       "(i)[" + x(80, "|a;") + "][|b;]"},
      {{{inform, x(100) + "\n" + x(36, "%") + "\n"},
        {inform, "z\n"},
        {inform, "waits"},
        {flush_inform},
        {inform, "\n"}},
       "(" + x(100) + "\n" + x(36, "%") + ")(z\nwaits)()"},  // 101 and 36 just fit
      {{{inform, x(140) + "\n"}}, "(" + x(137) + ")(xxx)"},
      {{{error, ""}}, ""},
      {{{error, "a\nb"}, {error, "% full"}}, "a\nb%% full\n"},
      {{{error, x(200) + "\nlost"}}, x(136) + "\n"},
      // 135 and a line end make 136: one more line end still fits, its text does not.
      {{{error, x(135) + "\ny\nz\n"}}, x(135) + "\n\n"},
      {{{error, x(130) + "\n" + x(20) + "\n"}}, x(130) + "\n" + x(5) + "\n"},
  });
}

TEST_F(Output, Formatted_text_is_cut_at_the_buffer) {
  EXPECT_EQ(serve(true,
                  [] {
                    EXPECT_EQ(dae_margin_printf(8, "%d%%", 12), -1);
                    EXPECT_EQ(dae_margin_printf(8, "%d", 12), 2);
                    EXPECT_EQ(dae_status_printf("%s", "body"), 4);
                    EXPECT_EQ(dae_error_printf("%s", x(5000).c_str()), 4095);
                    EXPECT_EQ(dae_inform_printf("%ls", L"\xdfff"), -1);  // cannot be formatted
                  }),
            "[12      |body;]" + x(136) + "\n");
}

TEST_F(Output, Channels_are_closed_outside_their_requests) {
  const auto status_is_closed = [] {
    return dae_status_puts("x") == -1 && dae_status_printf("x") == -1 && dae_margin_puts(3, "x") == -1 &&
           dae_margin_printf(3, "x") == -1 && dae_status_flush() == -1 && dae_status_short() == -1;
  };
  serve(true, [] {
    errno = EDOM;
    dae_status_puts("x");
    dae_status_flush();
    dae_status_short();
    EXPECT_EQ(errno, EDOM);
  });
  EXPECT_TRUE(status_is_closed());
  EXPECT_EQ(dae_inform_puts("x"), -1);
  EXPECT_EQ(dae_inform_flush(), -1);
  EXPECT_EQ(dae_error_printf("x"), -1);
  EXPECT_EQ(serve(false, [&] { EXPECT_TRUE(status_is_closed()); }), "");
}

TEST_F(Output, Short_status_gives_lines_and_the_subsystems_name) {
  fake_kpl::short_status = {
      {0, {{"Subsystem", "PID"}, {" sub7 x", "17"}}}, {0, {{"third", ""}}}, {-9, {{"x", ""}}}};
  EXPECT_EQ(serve(true,
                  [] {
                    dae_status_puts("before\n");
                    EXPECT_EQ(dae_status_short(), 0);
                    dae_status_puts("after\n");
                  }),
            "[|before;Subsystem|PID; sub7 x|17;third|;|after;]");

  const auto name = [](std::vector<fake_kpl::ShortStatus> answers) {
    fake_kpl::short_status = std::move(answers);
    errno = EDOM;
    char* text = dae_subsysname();
    EXPECT_EQ(errno, EDOM);
    const std::string result = text != nullptr ? text : "(null)";
    free(text);
    return result;
  };
  EXPECT_EQ(name({{0, {{"Subsystem", ""}, {"  sub7 group", ""}}}}), "sub7");
  EXPECT_EQ(name({{0, {{"Subsystem", ""}}}, {0, {{x(30), ""}}}}), x(29));
  EXPECT_EQ(name({{0, {{"Subsystem", ""}}}}), "(null)");
  dae_pid__INTERNAL__ = -1;
  EXPECT_EQ(name({{0, {{"Subsystem", ""}, {"sub7", ""}}}}), "(null)");
}

}  // namespace
