#include "property_list_check.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace kel::platform;
  checkReading(readBinaryPropertyList({data, size}, {512, 1U << 20}));
  return 0;
}
