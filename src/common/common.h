#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "common/debug_sink.h"
#include "platform/platform.h"

namespace kel {

/// True when the service launcher started this process: "QVRunningFromWarden" is exactly "1".
bool running_from_launcher(platform::SystemFacts& facts);

/// The path of the services cache, or absent when the platform gives no caches directory.
std::optional<std::string> cache_file_path(platform::StandardDirectories& directories);

/// The directories whose bundles offer services without being registered, in order, each with a trailing "/".
std::vector<std::string> explicit_service_directories(platform::StandardDirectories& directories);

/// The results of `transform` (optionals or pointers) that are present, in the order of `elements`.
template <typename Elements, typename Transform>
auto map_array(const Elements& elements, Transform&& transform) {
  std::vector<std::remove_cvref_t<decltype(*transform(*elements.begin()))>> results;
  for (const auto& element : elements) {
    if (auto result = transform(element)) results.push_back(std::move(*result));
  }
  return results;
}

/// Calls `work` once for every element, in parallel on the shared pool, each call with the caller's debug
/// sink installed; returns when all calls have returned.
template <typename Element, typename Work>
void apply_concurrently(platform::ConcurrentQueue& queue, const std::vector<Element>& elements, Work&& work) {
  const KELDebugSink sink = current_debug_sink();
  queue.apply(elements.size(),
              [&](std::size_t index) { run_with_debug_sink(sink, [&] { work(elements[index]); }); });
}

/// `elements` with `separator` between them.
std::string join(const std::vector<std::string>& elements, std::string_view separator);

}  // namespace kel
