// Names the last failure that this library met in this process, for wyx_get_ffdc_id. Any thread.
#pragma once

#include <cstddef>
#include <string>

namespace gs::client {

/// The buffer that wyx_get_ffdc_id wants, its final NUL included.
inline constexpr std::size_t kFailureIdSize = 64;

/// `what` is the word for what failed, at most 20 characters, `code` an errno or result code, `text` the failure
/// in words. The words that there are, the id's form and the line that GSD_DEBUG asks for: gscl/wyx_api.h.
void record_failure(const std::string& what, int code, const std::string& text);

/// Empty until something has failed.
std::string last_failure_id();

}  // namespace gs::client
