#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/guarded.h"

namespace kel {

/// Takes one line of diagnostic text, without a newline. Shared: installing one takes a reference.
using KELDebugSink = std::shared_ptr<const std::function<void(std::string_view)>>;

/// The sink installed on the calling thread, or null.
KELDebugSink current_debug_sink();

/// Installs `sink`, or none, on the calling thread until it ends or another one is installed.
void set_current_debug_sink(KELDebugSink sink);

/// Runs `work` with `sink` installed on the calling thread, then reinstalls what was there.
void run_with_debug_sink(const KELDebugSink& sink, const std::function<void()>& work);

/// Sends the line that `format` makes to the calling thread's sink; without a sink nothing is formatted.
template <typename Format>
void send_debug_line(Format&& format) {
  if (const KELDebugSink sink = current_debug_sink()) (*sink)(format());
}

/// Gathers the lines of one request, joined by newlines. Any thread.
class CollectingSink {
 public:
  /// A sink that adds to this buffer and keeps it alive.
  static std::pair<KELDebugSink, std::shared_ptr<CollectingSink>> make();

  std::string text() const { return text_.copy(); }

 private:
  void add(std::string_view line);

  platform::Guarded<std::string> text_;
};

}  // namespace kel
