#pragma once

#include <functional>
#include <string>

#include "common/debug_sink.h"

namespace kel::test {

/// The debug lines that `work` sends, joined by newlines.
inline std::string debugLines(const std::function<void()>& work) {
  const auto [sink, collected] = CollectingSink::make();
  run_with_debug_sink(sink, work);
  return collected->text();
}

}  // namespace kel::test
