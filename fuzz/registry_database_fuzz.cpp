// The application database: what is read must be what the writer writes. The input is taken as a whole file
// and as a payload, whose digest is made to fit.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "platform/linux/application_database.h"

namespace {

using namespace kel::platform;

void check(BytesView bytes) {
  const ApplicationDatabaseReading reading = decodeApplications(bytes);
  if (reading.applications.has_value() == !reading.error.empty()) std::abort();
  if (!reading.applications) return;
  const auto written = encodeApplications(*reading.applications);
  if (!written || !std::ranges::equal(*written, bytes)) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  check({data, size});
  check(sealApplicationDatabase({data, size}));
  return 0;
}
