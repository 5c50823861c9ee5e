// A subsystem's definition file: any bytes are a definition or a mistake that is told.
#include "master/definition.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  try {
    kpl::master::parse_definition({reinterpret_cast<const char*>(data), size}, "fuzzed.toml");
  } catch (const platform::SettingError&) {
    return 0;
  }
  return 0;
}
