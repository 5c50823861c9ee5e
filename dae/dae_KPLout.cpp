// The output channels of a request: text is broken into lines, lines are packed into KPL records, records are
// sent.
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>
#include <wchar.h>

#include <algorithm>

#include "dae/dae_failure_internal.h"

namespace {

/// How one channel builds its lines.
struct output_ctl_t {
  int margin_width_max;
  int body_width_max;
  int margin_width;  ///< columns before the body
  int body_width;
  unsigned double_percent : 1;  ///< every "%" of body text is written twice
  void (*pack_line)(const char* line, int len, const output_ctl_t* oc);  ///< stores one finished line
  void (*flush_out)();                                                   ///< sends what has been stored
  char* line_buffer;
  int buffer_size;
  int line_length;  ///< characters in line_buffer
};

enum output_ctl_ndx { STATUS_CTL, INFORM_CTL, ERROR_CTL, CTL_COUNT };
enum which_statcode { FIRST_STATCODE, NEXT_STATCODE };

constexpr int kMaxMargin = 29;
constexpr int kMaxBody = 64;
constexpr int kMaxInform = 137;
constexpr int kMaxError = 136;
constexpr int kStatusLines = 80;
constexpr int kShortLines = 2;
constexpr int kPrintfSize = 4096;
constexpr int kErrorSize = kMaxError + 2;  // a line end and a NUL
constexpr int kLinesOffset = offsetof(statrep, statcode);
constexpr int kLineSize = sizeof(statcode);
constexpr int kStatusSize = kLinesOffset + kStatusLines * kLineSize;
constexpr int kShortSize = kLinesOffset + kShortLines * kLineSize;
constexpr int kMessageOffset = offsetof(kplrep, svrreply) + offsetof(svrreply, rtnmsg);

output_ctl_t channels[CTL_COUNT];
char* line_buffers[CTL_COUNT];
char* printf_buf;

char* STATUS_statrep;
int STATUS_cur_statcode;  ///< index of the record being filled
char* STATUS_short_statrep;
kplhdr* STATUS_kplhdr;  ///< header of the request being served in status mode

kplrep* INFORM_kplrep;
int INFORM_reply_len;  ///< characters collected

char* ERROR_msgs;
int ERROR_msgs_len;  ///< characters collected

kplhdr* KPL_kplhdr;  ///< header of the request being served

// ---- Status lines ----

statcode* status_record(int index) {
  return reinterpret_cast<statcode*>(STATUS_statrep + kLinesOffset + index * kLineSize);
}

bool is_empty(const statcode& record) { return record.objname[0] == '\0' && record.objtext[0] == '\0'; }

void xmit_status() {
  if (STATUS_cur_statcode == 0) return;
  kplsrpy(STATUS_kplhdr, STATUS_statrep, kLinesOffset + STATUS_cur_statcode * kLineSize, KPL_CONT_STATUS);
}

/// A record made only of empty lines loses its last line end: the record is itself a line.
void finish_statcode(statcode* record) {
  const size_t length = strnlen(record->objtext, sizeof record->objtext);
  if (record->objname[0] != '\0' || record->objtext[0] != '\n') return;
  if (record->objtext[length - 1] == '\n') record->objtext[length - 1] = '\0';
}

void change_cur_statcode(which_statcode which) {
  if (which == NEXT_STATCODE) {
    finish_statcode(status_record(STATUS_cur_statcode));
    ++STATUS_cur_statcode;
    if (STATUS_cur_statcode == kStatusLines) xmit_status();
  }
  if (which == FIRST_STATCODE || STATUS_cur_statcode == kStatusLines) STATUS_cur_statcode = 0;
  memset(status_record(STATUS_cur_statcode), 0, kLineSize);
}

void pack_empty_status() {
  if (strlen(status_record(STATUS_cur_statcode)->objtext) >= kMaxBody) change_cur_statcode(NEXT_STATCODE);
  char* text = status_record(STATUS_cur_statcode)->objtext;
  text[strlen(text)] = '\n';  // the record was cleared, so a NUL follows
}

void pack_status(const char* line, int len, const output_ctl_t* oc) {
  if (len == 0) return pack_empty_status();
  if (!is_empty(*status_record(STATUS_cur_statcode))) change_cur_statcode(NEXT_STATCODE);
  statcode* record = status_record(STATUS_cur_statcode);
  memcpy(record->objname, line, std::min({len, oc->margin_width, kMaxMargin}));
  if (len > oc->margin_width) {
    memcpy(record->objtext, line + oc->margin_width, std::min(len - oc->margin_width, kMaxBody));
  }
}

void flush_status() {
  if (!is_empty(*status_record(STATUS_cur_statcode))) change_cur_statcode(NEXT_STATCODE);
  xmit_status();
  change_cur_statcode(FIRST_STATCODE);
}

// ---- Inform text ----

void xmit_inform() {
  if (INFORM_reply_len == 0) return;
  char* text = INFORM_kplrep->svrreply.rtnmsg;
  text[INFORM_reply_len - 1] = '\0';
  kplsrpy(KPL_kplhdr, reinterpret_cast<char*>(INFORM_kplrep), kMessageOffset + 1 + INFORM_reply_len,
          KPL_CONT_MESSAGE);
}

void flush_inform() {
  xmit_inform();
  INFORM_reply_len = 0;
  memset(INFORM_kplrep, 0, sizeof *INFORM_kplrep);
}

void pack_inform(const char* line, int len, const output_ctl_t*) {
  if (INFORM_reply_len > 0 && INFORM_reply_len + len > kMaxInform) flush_inform();
  char* text = INFORM_kplrep->svrreply.rtnmsg;
  const int taken = std::min(len, kMaxInform);
  memcpy(text + INFORM_reply_len, line, taken);
  INFORM_reply_len += taken;
  text[INFORM_reply_len++] = '\n';
}

// ---- Error text ----

void pack_error(const char* line, int len, const output_ctl_t*) {
  if (ERROR_msgs_len > kMaxError) return;
  const int taken = std::min(len, kMaxError - ERROR_msgs_len);
  memcpy(ERROR_msgs + ERROR_msgs_len, line, taken);
  ERROR_msgs_len += taken;
  ERROR_msgs[ERROR_msgs_len++] = '\n';
}

void flush_error() {}

// ---- Line building ----

const output_ctl_t kSettings[CTL_COUNT] = {
    {kMaxMargin, kMaxBody, 0, kMaxBody, 1, pack_status, flush_status, nullptr, kMaxMargin + kMaxBody, 0},
    {0, kMaxInform, 0, kMaxInform, 0, pack_inform, flush_inform, nullptr, kMaxInform, 0},
    {0, kMaxError, 0, kMaxError, 1, pack_error, flush_error, nullptr, kMaxError, 0},
};

void reset_channel(output_ctl_ndx index) {
  channels[index] = kSettings[index];
  channels[index].line_buffer = line_buffers[index];
}

/// One piece of text on its way into a line.
struct Segment {
  const char* text;
  int length;
  bool ends_line;
};

void pack_waiting(output_ctl_t* oc) {
  if (oc->line_length == 0) return;
  oc->pack_line(oc->line_buffer, oc->line_length, oc);
  oc->line_length = 0;
}

void append(output_ctl_t* oc, const char* text, int length) {
  memcpy(oc->line_buffer + oc->line_length, text, length);
  oc->line_length += length;
}

void pad_margin(output_ctl_t* oc) {
  while (oc->line_length < oc->margin_width) oc->line_buffer[oc->line_length++] = ' ';
}

/// Cuts the segment to `room` bytes, between characters of at most `widest` bytes. False for one that is wider or
/// that the locale rejects.
bool cut_segment(Segment* segment, int room, int widest) {
  segment->ends_line = true;
  segment->length = std::max(room, 0);
  if (MB_CUR_MAX == 1) return true;
  int taken = 0;
  while (taken < segment->length) {
    const int width = mblen(segment->text + taken, MB_CUR_MAX);
    if (width < 1 || width > widest) return false;
    if (taken + width > segment->length) break;
    taken += width;
  }
  segment->length = taken;
  return true;
}

void add_segment(output_ctl_t* oc, const Segment& segment, bool doubles) {
  const bool percent = doubles && segment.length > 0 && segment.text[segment.length - 1] == '%';
  const bool whole_line = oc->line_length == 0 && segment.ends_line;
  if (percent || !whole_line) append(oc, segment.text, segment.length);
  if (percent) append(oc, "%", 1);
  if (!segment.ends_line) return;
  if (oc->line_length > 0) return pack_waiting(oc);
  oc->pack_line(segment.text, segment.length, oc);
}

/// Length of the piece of text up to the next line end or, in text whose "%" is doubled, through the first "%".
/// Not more than `most` is looked at, so that a long line costs no more than a short one at each of its breaks.
int segment_length(const char* text, bool doubles, int most) {
  int length = 0;
  while (length < most && text[length] != '\0' && text[length] != '\n') {
    if (text[length++] == '%' && doubles) break;
  }
  return length;
}

/// Breaks text into lines. False when a character cannot be written; what stood before its segment is taken.
bool put_text(output_ctl_t* oc, const char* text, bool margin) {
  const bool doubles = oc->double_percent && !margin;
  const int column = margin ? oc->margin_width : oc->body_width;
  const int limit = margin ? oc->margin_width : oc->margin_width + oc->body_width;
  const int widest = std::min(static_cast<int>(MB_CUR_MAX), column);
  while (*text != '\0') {
    Segment segment = {text, segment_length(text, doubles, limit + 1), false};
    segment.ends_line = text[segment.length] == '\n';
    if (!margin && segment.length > 0) pad_margin(oc);
    if (oc->line_length + segment.length > limit && !cut_segment(&segment, limit - oc->line_length, widest)) {
      return false;
    }
    // A "%" in the last column has no room for its double.
    const bool percent = doubles && segment.length > 0 && text[segment.length - 1] == '%';
    if (percent && oc->line_length + segment.length == limit) {
      --segment.length;
      segment.ends_line = true;
    }
    add_segment(oc, segment, doubles);
    text += segment.length;
    if (*text == '\n') ++text;
  }
  return true;
}

void set_margin(output_ctl_t* oc, int new_width) {
  const int width = std::min(new_width, oc->margin_width_max);
  if (width == oc->margin_width) return;
  pack_waiting(oc);
  oc->margin_width = width;
}

bool is_newlines(const char* text) { return text[strspn(text, "\n")] == '\0'; }

int put_body(output_ctl_ndx index, const char* text) {
  return put_text(&channels[index], text, false) ? static_cast<int>(strlen(text)) : -1;
}

int put_margin(int new_width, const char* text) {
  output_ctl_t* oc = &channels[STATUS_CTL];
  if (strchr(text, '%') != nullptr) return -1;
  if (new_width >= 0) set_margin(oc, new_width);
  if (oc->margin_width == 0 && !is_newlines(text)) return -1;
  return put_text(oc, text, true) ? static_cast<int>(strlen(text)) : -1;
}

int flush(output_ctl_ndx index) {
  pack_waiting(&channels[index]);
  channels[index].flush_out();
  return 0;
}

bool is_open(output_ctl_ndx index) {
  return index == STATUS_CTL ? STATUS_kplhdr != nullptr : KPL_kplhdr != nullptr;
}

/// Takes off what a cut has left of a last character.
void drop_partial_character(char* text) {
  mbstate_t state = {};
  for (size_t rest = strlen(text); rest > 0;) {
    size_t width = mbrlen(text, rest, &state);
    if (width == static_cast<size_t>(-2)) {
      *text = '\0';
      return;
    }
    if (width == static_cast<size_t>(-1)) {  // no character; the line builder judges it
      width = 1;
      state = {};
    }
    text += width;
    rest -= width;
  }
}

/// Formats into printf_buf, cut between characters to what fits. False when it cannot be formatted.
bool format(const char* fmt, va_list args) {
  const int length = vsnprintf(printf_buf, kPrintfSize, fmt, args);
  if (length >= kPrintfSize) drop_partial_character(printf_buf);
  return length >= 0;
}

int body_puts(output_ctl_ndx index, const char* text) {
  dae::KeepErrno keep_errno;
  return is_open(index) ? put_body(index, text) : -1;
}

int body_vprintf(output_ctl_ndx index, const char* fmt, va_list args) {
  dae::KeepErrno keep_errno;
  if (!is_open(index) || !format(fmt, args)) return -1;
  return put_body(index, printf_buf);
}

int flush_channel(output_ctl_ndx index) {
  dae::KeepErrno keep_errno;
  return is_open(index) ? flush(index) : -1;
}

// ---- Set-up ----

template <class T>
bool allocate(T** buffer, int size) {
  if (*buffer == nullptr) *buffer = static_cast<T*>(calloc(1, size));
  return *buffer != nullptr;
}

bool allocate_line(output_ctl_ndx index) { return allocate(&line_buffers[index], kSettings[index].buffer_size); }

bool allocate_buffers() {
  if (!allocate(&printf_buf, kPrintfSize)) return false;
  if (!allocate_line(INFORM_CTL) || !allocate_line(ERROR_CTL)) return false;
  if (!allocate(&INFORM_kplrep, sizeof(kplrep)) || !allocate(&ERROR_msgs, kErrorSize)) return false;
  if (dae_prof__INTERNAL__.long_status == nullptr) return true;
  return allocate_line(STATUS_CTL) && allocate(&STATUS_statrep, kStatusSize) &&
         allocate(&STATUS_short_statrep, kShortSize);
}

// ---- Short status ----

/// Asks the master for the short status of this process and hands each record to `take`. A failure ends it.
template <class Taker>
void query_short_status(Taker take) {
  char nothing[] = "";
  int cont = KPL_CONT_FIRST;
  while (cont != KPL_CONT_END) {
    short length = kShortSize;
    if (kplstat(nothing, nothing, getpid(), &length, STATUS_short_statrep, &cont) != 0) return;
    const int count = std::min((length - kLinesOffset) / kLineSize, kShortLines);
    for (int i = 0; i < count; ++i) take(STATUS_short_statrep + kLinesOffset + i * kLineSize);
  }
}

}  // namespace

int dae_output_init__INTERNAL__() {
  if (dae_prof__INTERNAL__.KPL_comm == DAE_C_SIG) return DAE_OK;
  return allocate_buffers() ? DAE_OK : dae::fail_call(DAE_E_KPL, "malloc");
}

void dae_output_open__INTERNAL__(kplhdr* header, int status) {
  if (ERROR_msgs == nullptr) return;  // never set up: the channels stay closed
  reset_channel(INFORM_CTL);
  reset_channel(ERROR_CTL);
  memset(INFORM_kplrep, 0, sizeof *INFORM_kplrep);
  INFORM_reply_len = 0;
  ERROR_msgs_len = 0;
  KPL_kplhdr = header;
  STATUS_kplhdr = status && STATUS_statrep != nullptr ? header : nullptr;
  if (STATUS_kplhdr == nullptr) return;
  reset_channel(STATUS_CTL);
  change_cur_statcode(FIRST_STATCODE);
}

void dae_output_close__INTERNAL__(const char** emsg) {
  if (emsg != nullptr) *emsg = nullptr;
  if (KPL_kplhdr == nullptr) return;
  if (STATUS_kplhdr != nullptr) flush(STATUS_CTL);
  flush(INFORM_CTL);
  flush(ERROR_CTL);
  ERROR_msgs[ERROR_msgs_len] = '\0';
  if (emsg != nullptr && ERROR_msgs_len > 0) *emsg = ERROR_msgs;
  STATUS_kplhdr = nullptr;
  KPL_kplhdr = nullptr;
}

int dae_status_puts(const char* s) { return body_puts(STATUS_CTL, s); }
int dae_inform_puts(const char* s) { return body_puts(INFORM_CTL, s); }
int dae_error_puts(const char* s) { return body_puts(ERROR_CTL, s); }

int dae_margin_puts(int new_width, const char* s) {
  dae::KeepErrno keep_errno;
  return is_open(STATUS_CTL) ? put_margin(new_width, s) : -1;
}

int dae_status_vprintf(const char* fmt, va_list args) { return body_vprintf(STATUS_CTL, fmt, args); }
int dae_inform_vprintf(const char* fmt, va_list args) { return body_vprintf(INFORM_CTL, fmt, args); }
int dae_error_vprintf(const char* fmt, va_list args) { return body_vprintf(ERROR_CTL, fmt, args); }

int dae_margin_vprintf(int new_width, const char* fmt, va_list args) {
  dae::KeepErrno keep_errno;
  if (!is_open(STATUS_CTL) || !format(fmt, args)) return -1;
  return put_margin(new_width, printf_buf);
}

int dae_status_printf(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int result = dae_status_vprintf(fmt, args);
  va_end(args);
  return result;
}

int dae_margin_printf(int new_width, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int result = dae_margin_vprintf(new_width, fmt, args);
  va_end(args);
  return result;
}

int dae_inform_printf(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int result = dae_inform_vprintf(fmt, args);
  va_end(args);
  return result;
}

int dae_error_printf(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int result = dae_error_vprintf(fmt, args);
  va_end(args);
  return result;
}

int dae_status_flush() { return flush_channel(STATUS_CTL); }
int dae_inform_flush() { return flush_channel(INFORM_CTL); }

int dae_status_short() {
  dae::KeepErrno keep_errno;
  if (STATUS_kplhdr == nullptr || STATUS_short_statrep == nullptr) return -1;
  if (!is_empty(*status_record(STATUS_cur_statcode))) change_cur_statcode(NEXT_STATCODE);
  query_short_status([](const char* record) {
    memcpy(status_record(STATUS_cur_statcode), record, kLineSize);
    change_cur_statcode(NEXT_STATCODE);
  });
  return 0;
}

char* dae_subsysname() {
  dae::KeepErrno keep_errno;
  if (!dae_process_is_the_daemon() || !allocate(&STATUS_short_statrep, kShortSize)) return nullptr;
  char* name = nullptr;
  int index = 0;
  query_short_status([&](const char* record) {
    if (index++ != 1) return;  // the first line is the heading
    char margin[sizeof(statcode::objname) + 1] = {};
    memcpy(margin, record + offsetof(statcode, objname), sizeof(statcode::objname));
    name = static_cast<char*>(calloc(1, sizeof(statcode::objname)));
    if (name != nullptr) sscanf(margin, " %29s", name);
  });
  return name;
}
