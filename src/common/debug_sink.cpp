#include "common/debug_sink.h"

#include <utility>

namespace kel {

namespace {

KELDebugSink& slot() {
  thread_local KELDebugSink sink;
  return sink;
}

}  // namespace

KELDebugSink current_debug_sink() { return slot(); }

void set_current_debug_sink(KELDebugSink sink) {
  // The old sink is let go of after the new one stands: its destructor may itself ask for the current sink.
  if (sink != slot()) std::swap(slot(), sink);
}

void run_with_debug_sink(const KELDebugSink& sink, const std::function<void()>& work) {
  struct Restore {
    KELDebugSink previous = current_debug_sink();
    ~Restore() { set_current_debug_sink(std::move(previous)); }
  } const restore;
  set_current_debug_sink(sink);
  work();
}

std::pair<KELDebugSink, std::shared_ptr<CollectingSink>> CollectingSink::make() {
  auto buffer = std::make_shared<CollectingSink>();
  auto sink = std::make_shared<const std::function<void(std::string_view)>>(
      [buffer](std::string_view line) { buffer->add(line); });
  return {std::move(sink), std::move(buffer)};
}

void CollectingSink::add(std::string_view line) {
  text_.with([line](std::string& text) {
    if (!text.empty()) text += '\n';
    text += line;
  });
}

}  // namespace kel
