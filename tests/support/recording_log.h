#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/guarded.h"
#include "platform/system_log.h"

namespace kel::test {

/// Keeps what is logged, whole and in order. Any thread.
class RecordingLog : public platform::SystemLog {
 public:
  void write(std::string_view message) override {
    messages_.with([&](auto& messages) { messages.emplace_back(message); });
  }

  std::vector<std::string> messages() const { return messages_.copy(); }

  /// The messages so far, which are forgotten.
  std::vector<std::string> take() {
    return messages_.with([](auto& messages) { return std::exchange(messages, {}); });
  }

 private:
  platform::Guarded<std::vector<std::string>> messages_;
};

}  // namespace kel::test
