// Names the last failure that this library met in this process, for wyx_get_ffdc_id. Any thread.
#pragma once

#include <cstddef>
#include <string>

namespace gs::client {

/// The buffer that wyx_get_ffdc_id wants, its final NUL included.
inline constexpr std::size_t kFailureIdSize = 64;

/// `what` is a short word for the step that failed, `code` an errno or result code.
/// The id reads what-code-pid-count-time, the time in UTC: connect-111-4711-3-20260131T235959Z.
void record_failure(const char* what, int code);

/// Empty until something has failed.
std::string last_failure_id();

}  // namespace gs::client
