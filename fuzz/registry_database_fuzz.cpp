#include "platform/linux/registry/application_database.h"
#include "sealed_check.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace kel::platform;
  const auto rewrite = [](BytesView file) -> std::optional<Bytes> {
    const auto applications = decodeApplications(file);
    if (!applications) return std::nullopt;
    auto written = encodeApplications(*applications);
    if (!written || decodeApplications(*written) != applications) std::abort();
    return written;
  };
  checkRewriting({data, size}, applicationDatabaseFormat, rewrite);
  return 0;
}
