#pragma once

#include <optional>
#include <string_view>
#include <vector>

#include "platform/guarded.h"
#include "platform/services_publication.h"

namespace kel::test {

/// Keeps every publication; the last one is the preference that other processes read. Any thread.
class InMemoryPublication : public platform::ServicesPublication, public platform::Preferences {
 public:
  void publish(const platform::PropertyListValue& publication) override;
  std::optional<platform::PropertyListValue> value(std::string_view domain, std::string_view key) override;

  std::vector<platform::PropertyListValue> publications() const { return publications_.copy(); }

 private:
  mutable platform::Guarded<std::vector<platform::PropertyListValue>> publications_;
};

}  // namespace kel::test
