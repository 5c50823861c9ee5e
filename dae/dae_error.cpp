// The error detail: the caller's record of the step that failed.
#include <stdio.h>
#include <string.h>

#include "dae/dae_internal.h"

namespace {

dae_error_detail_t* saved_error_detail = nullptr;

template <size_t Size>
void copy_text(char (&field)[Size], const char* text) {
  const size_t length = strnlen(text, Size - 1);
  memcpy(field, text, length);
  memset(field + length, 0, Size - length);
}

const char* base_name(const char* path) {
  const char* slash = strrchr(path, '/');
  return slash == nullptr ? path : slash + 1;
}

}  // namespace

void dae_detail_init__INTERNAL__(dae_error_detail_t* error_detail, const char* dae_routine) {
  saved_error_detail = error_detail;
  if (error_detail == nullptr) return;
  *error_detail = {};
  copy_text(error_detail->dae_routine, dae_routine);
}

void dae_detail_error__INTERNAL__(const char* error_string, const char* filename, const char* fileversion,
                                  long fileline) {
  if (saved_error_detail == nullptr) return;
  copy_text(saved_error_detail->dae_error_string, error_string);
  copy_text(saved_error_detail->dae_filename, base_name(filename));
  copy_text(saved_error_detail->dae_fileversion, fileversion);
  saved_error_detail->dae_fileline = fileline;
}

void dae_detail_errno__INTERNAL__(const char* routine_name, int errno_value, const char* filename,
                                  const char* fileversion, long fileline) {
  if (saved_error_detail == nullptr) return;
  char text[sizeof saved_error_detail->dae_error_string];
  snprintf(text, sizeof text, "%s failed: %s", routine_name, strerror(errno_value));
  dae_detail_error__INTERNAL__(text, filename, fileversion, fileline);
}

int dae_detail_is_set__INTERNAL__() {
  return saved_error_detail != nullptr && saved_error_detail->dae_fileline != 0;
}
