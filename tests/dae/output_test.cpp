// The output channels: how text becomes lines, lines become records, and when packets go out.
#include <errno.h>
#include <locale.h>
#include <stdlib.h>
#include <unistd.h>

#include <functional>
#include <string>

#include "dae/dae_internal.h"
#include "fake_kpl.h"

namespace {

using fake_kpl::Line;
using testing::ElementsAre;
using testing::IsEmpty;
using Lines = std::vector<Line>;

/// Runs text through the channels as if a request were served.
class Output : public testing::Test {
 protected:
  Output() {
    fake_kpl::reset();
    dae_pid__INTERNAL__ = getpid();
    dae_prof__INTERNAL__.KPL_comm = DAE_C_SOCK;
    dae_prof__INTERNAL__.long_status = [] {};
    EXPECT_EQ(dae_output_init__INTERNAL__(), 0);
  }
  ~Output() override { setlocale(LC_ALL, "C"); }

  /// Returns the error text, "(none)" when there is none.
  std::string serve(bool status, const std::function<void()>& routine) {
    char request[sizeof(kplhdr)] = {};
    fake_kpl::packets.clear();
    dae_output_open__INTERNAL__(kplrrqs(request), status);
    routine();
    const char* error_text = nullptr;
    dae_output_close__INTERNAL__(&error_text);
    return error_text != nullptr ? error_text : "(none)";
  }

  Lines status(const std::function<void()>& routine) {
    serve(true, routine);
    return fake_kpl::status_lines();
  }
};

std::string x(int count, char c = 'x') { return std::string(static_cast<size_t>(count), c); }

TEST_F(Output, Status_margin_and_body_share_a_record) {
  EXPECT_THAT(status([] {
                EXPECT_EQ(dae_margin_puts(10, "name"), 4);
                EXPECT_EQ(dae_status_puts("value\n"), 6);
                dae_status_puts("more\n");      // padded with an empty margin
                dae_margin_puts(-1, "m\n");     // a margin alone, its width kept
                dae_margin_puts(40, "wide\n");  // capped at 29
                dae_status_printf("%d%s", 7, "\n");
              }),
              ElementsAre(Line{"name      ", "value"}, Line{"          ", "more"}, Line{"m", ""}, Line{"wide", ""},
                          Line{x(29, ' '), "7"}));
}

TEST_F(Output, Status_margin_change_ends_the_waiting_line) {
  EXPECT_THAT(status([] {
                dae_margin_puts(4, "ab");
                dae_margin_puts(6, "cd");  // another width: "ab" becomes a line under the old one
                dae_margin_puts(6, "ef");  // the same width: goes on
                dae_status_puts("body");
                dae_margin_puts(-1, "gh");  // behind body text there is no margin left in this line
              }),
              ElementsAre(Line{"ab", ""}, Line{"cdef  ", "body"}, Line{"gh", ""}));
}

TEST_F(Output, Status_long_lines_break_at_column_ends) {
  EXPECT_THAT(status([] { dae_status_puts((x(100) + "\n").c_str()); }),
              ElementsAre(Line{"", x(64)}, Line{"", x(36)}));
  EXPECT_THAT(status([] {
                dae_margin_puts(3, "abcdefgh\n");
                dae_status_puts((x(64) + "\nz").c_str());
              }),
              ElementsAre(Line{"abc", ""}, Line{"def", ""}, Line{"gh", ""}, Line{"   ", x(64)}, Line{"   ", "z"}));
  EXPECT_THAT(status([] {
                dae_status_puts(x(60).c_str());  // a line that grows piece by piece
                dae_status_puts(x(4).c_str());
                dae_status_puts("y\n");
              }),
              ElementsAre(Line{"", x(64)}, Line{"", "y"}));
}

TEST_F(Output, Status_empty_lines_ride_on_the_record_before) {
  EXPECT_THAT(status([] { dae_status_puts("text\n\n\n\n"); }), ElementsAre(Line{"", "text\n\n\n"}));
  EXPECT_THAT(status([] { dae_status_puts("\n\n"); }), ElementsAre(Line{"", "\n"}));
  EXPECT_THAT(status([] { dae_status_puts("\n"); }), ElementsAre(Line{"", ""}));
  EXPECT_THAT(status([] { dae_status_puts((x(64) + "\n\nnext").c_str()); }),
              ElementsAre(Line{"", x(64)}, Line{"", ""}, Line{"", "next"}));
  EXPECT_THAT(status([] {
                dae_margin_puts(2, "\n");  // no padding for an empty line
                dae_status_puts("\n");
                dae_margin_puts(2, "m\n\n");
              }),
              ElementsAre(Line{"", "\n"}, Line{"m", "\n"}));
  EXPECT_THAT(status([] { dae_margin_puts(0, "\n\n"); }), ElementsAre(Line{"", "\n"}));
  EXPECT_THAT(
      status([] { dae_status_puts(x(200, '\n').c_str()); }),
      ElementsAre(Line{"", x(63, '\n')}, Line{"", x(63, '\n')}, Line{"", x(63, '\n')}, Line{"", x(7, '\n')}));
}

TEST_F(Output, Percent_is_doubled_and_never_parted_from_its_double) {
  EXPECT_THAT(status([] { dae_status_puts("50% and 60%\n%"); }),
              ElementsAre(Line{"", "50%% and 60%%"}, Line{"", "%%"}));
  // In column 63 the sign and its double fill the line; in column 64 they go to the next one.
  EXPECT_THAT(status([] { dae_status_puts((x(62) + "%z\n").c_str()); }),
              ElementsAre(Line{"", x(62) + "%%"}, Line{"", "z"}));
  EXPECT_THAT(status([] { dae_status_puts((x(63) + "%z\n").c_str()); }),
              ElementsAre(Line{"", x(63)}, Line{"", "%%z"}));
  EXPECT_THAT(status([] { dae_status_puts(x(64, '%').c_str()); }),
              ElementsAre(Line{"", x(64, '%')}, Line{"", x(64, '%')}));
  EXPECT_EQ(serve(false, [] { dae_error_puts("disk 100% full"); }), "disk 100%% full\n");
  serve(false, [] { dae_inform_puts("100%"); });
  EXPECT_THAT(fake_kpl::messages(), ElementsAre("100%"));
}

TEST_F(Output, Margin_refuses_percent_and_text_without_width) {
  EXPECT_THAT(status([] {
                EXPECT_EQ(dae_margin_puts(8, "a%"), -1);
                EXPECT_EQ(dae_margin_puts(-1, "a"), -1);  // the refused call set no width
                EXPECT_EQ(dae_margin_puts(-1, "\na"), -1);
                EXPECT_EQ(dae_margin_printf(8, "%d", 12), 2);
                EXPECT_EQ(dae_margin_printf(8, "%d%%", 12), -1);
              }),
              ElementsAre(Line{"12", ""}));
}

TEST_F(Output, Multibyte_characters_stay_whole) {
  if (setlocale(LC_ALL, "C.UTF-8") == nullptr) GTEST_SKIP() << "no locale C.UTF-8";
  const std::string euro = "\xe2\x82\xac";  // three bytes
  EXPECT_THAT(status([&] { dae_status_puts((x(63) + euro + "z\n").c_str()); }),
              ElementsAre(Line{"", x(63)}, Line{"", euro + "z"}));
  EXPECT_THAT(status([&] {
                dae_status_puts("kept\n");
                EXPECT_EQ(dae_status_puts((x(60) + "\xff" + x(20) + "\n").c_str()), -1);
                EXPECT_EQ(dae_margin_puts(2, (euro + "\n").c_str()), -1);  // wider than the column
                EXPECT_EQ(dae_margin_puts(3, (euro + "\n").c_str()), 4);
              }),
              ElementsAre(Line{"", "kept"}, Line{euro, ""}));
}

TEST_F(Output, Status_packets_hold_eighty_lines_and_none_is_empty) {
  const auto write = [](int count) {
    return [count] {
      for (int i = 0; i < count; ++i) dae_status_printf("line %d\n", i);
    };
  };
  const Lines lines = status(write(81));
  ASSERT_EQ(lines.size(), 81u);
  EXPECT_EQ(lines[80], (Line{"", "line 80"}));
  EXPECT_THAT(fake_kpl::status_packet_sizes(), ElementsAre(80, 1));
  status(write(80));
  EXPECT_THAT(fake_kpl::status_packet_sizes(), ElementsAre(80));
  serve(true, [&] {
    write(80)();
    EXPECT_THAT(fake_kpl::status_packet_sizes(), IsEmpty());  // the 80th is sent when the next one is needed
    EXPECT_EQ(dae_status_flush(), 0);
    EXPECT_EQ(dae_status_flush(), 0);
    dae_status_puts("tail");
    dae_status_flush();  // a line that waits goes too
  });
  EXPECT_THAT(fake_kpl::status_packet_sizes(), ElementsAre(80, 1));
  EXPECT_THAT(status([] {}), IsEmpty());
  status(write(1000));
  EXPECT_EQ(fake_kpl::status_packet_sizes().size(), 13u);
}

TEST_F(Output, Inform_lines_share_packets_up_to_their_size) {
  serve(false, [] { dae_inform_puts("one\ntwo\n"); });
  EXPECT_THAT(fake_kpl::messages(), ElementsAre("one\ntwo"));
  serve(false, [] {
    dae_inform_puts((x(100) + "\n" + x(36, 'y') + "\n").c_str());  // 101 and 36: just fits
    dae_inform_puts("z\n");
    dae_inform_puts("waits");
    EXPECT_EQ(dae_inform_flush(), 0);
    dae_inform_puts("\n");
  });
  EXPECT_THAT(fake_kpl::messages(), ElementsAre(x(100) + "\n" + x(36, 'y'), "z\nwaits", ""));
  serve(false, [] { dae_inform_puts((x(140) + "\n").c_str()); });
  EXPECT_THAT(fake_kpl::messages(), ElementsAre(x(137), "xxx"));
  // A shorter text leaves nothing of a longer one behind its end.
  serve(false, [] {
    dae_inform_puts(x(137).c_str());
    dae_inform_flush();
    dae_inform_puts("short");
  });
  EXPECT_EQ(fake_kpl::packets.back().bytes.substr(217), std::string("short\0\0", 7));
}

TEST_F(Output, Error_text_is_cut_at_its_limit) {
  EXPECT_EQ(serve(false, [] {}), "(none)");
  EXPECT_EQ(serve(false, [] { dae_error_printf("%s", ""); }), "(none)");
  EXPECT_EQ(serve(false, [] { dae_error_puts("a\nb"); }), "a\nb\n");
  EXPECT_EQ(serve(false, [] { dae_error_puts((x(200) + "\nlost").c_str()); }), x(136) + "\n");
  // 135 and a line end make 136: one more line end still fits, its text does not.
  EXPECT_EQ(serve(false, [] { dae_error_puts((x(135) + "\ny\nz\n").c_str()); }), x(135) + "\n\n");
  EXPECT_EQ(serve(false, [] { dae_error_puts((x(130) + "\n" + x(20, 'y') + "\n").c_str()); }),
            x(130) + "\n" + x(5, 'y') + "\n");
}

TEST_F(Output, Formatted_text_is_cut_at_the_buffer) {
  const std::string text = x(5000);
  serve(false, [&] { EXPECT_EQ(dae_inform_printf("%s", text.c_str()), 4095); });
  std::string all;
  for (const std::string& message : fake_kpl::messages()) all += message;
  EXPECT_EQ(all, x(4095));
  serve(false, [] { EXPECT_EQ(dae_inform_printf("%ls", L"\xdfff"), -1); });  // cannot be formatted
}

TEST_F(Output, Channels_are_closed_outside_their_requests) {
  const auto status_is_closed = [] {
    return dae_status_puts("x") == -1 && dae_status_printf("x") == -1 && dae_margin_puts(3, "x") == -1 &&
           dae_margin_printf(3, "x") == -1 && dae_status_flush() == -1 && dae_status_short() == -1;
  };
  EXPECT_TRUE(status_is_closed());
  EXPECT_EQ(dae_inform_puts("x"), -1);
  EXPECT_EQ(dae_inform_flush(), -1);
  EXPECT_EQ(dae_error_printf("x"), -1);
  EXPECT_EQ(serve(false,
                  [&] {
                    EXPECT_TRUE(status_is_closed());
                    dae_error_puts("open");
                  }),
            "open\n");
  errno = EDOM;
  status([] {
    dae_status_puts("x");
    dae_status_flush();
    dae_status_short();
    EXPECT_EQ(errno, EDOM);
  });
}

TEST_F(Output, Short_status_lines_come_between_the_own_ones) {
  fake_kpl::short_status = {{0, {{"Subsystem", "PID"}, {" sub7 x", "17 active"}}}, {0, {{"third", ""}}}};
  EXPECT_THAT(status([] {
                dae_status_puts("before\n");
                EXPECT_EQ(dae_status_short(), 0);
                dae_status_puts("after\n");
              }),
              ElementsAre(Line{"", "before"}, Line{"Subsystem", "PID"}, Line{" sub7 x", "17 active"},
                          Line{"third", ""}, Line{"", "after"}));
  fake_kpl::short_status = {{0, {{"Subsystem", "PID"}}}, {-9, {{"not", "taken"}}}};
  EXPECT_THAT(status([] { EXPECT_EQ(dae_status_short(), 0); }), ElementsAre(Line{"Subsystem", "PID"}));
}

TEST_F(Output, Subsystem_name_is_the_first_word_of_the_second_line) {
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
  EXPECT_EQ(name({}), "(null)");
  dae_pid__INTERNAL__ = -1;
  EXPECT_EQ(name({{0, {{"Subsystem", ""}, {"sub7", ""}}}}), "(null)");
}

}  // namespace
