#include "support/in_memory_publication.h"

namespace kel::test {

void InMemoryPublication::publish(const platform::PropertyListValue& publication) {
  publications_.with([&](auto& publications) { publications.push_back(publication); });
}

std::optional<platform::PropertyListValue> InMemoryPublication::value(std::string_view domain,
                                                                      std::string_view key) {
  if (domain != "com.orvex.ServicesMenu.Services" || key != "QVServices") return std::nullopt;
  return publications_.with([](const auto& publications) -> std::optional<platform::PropertyListValue> {
    if (publications.empty()) return std::nullopt;
    return publications.back();
  });
}

}  // namespace kel::test
