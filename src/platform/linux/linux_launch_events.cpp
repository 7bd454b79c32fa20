#include "platform/linux/linux_launch_events.h"

#include <string>

namespace kel::platform {

LinuxLaunchEvents::~LinuxLaunchEvents() {
  for (Source& source : sources_) {
    const auto stop = [&source] { source.observation.reset(); };
    if (source.queue.isCurrent()) {
      stop();
    } else {
      source.queue.sync(stop);
    }
  }
}

void LinuxLaunchEvents::setHandler(std::string_view stream, SerialQueue& queue,
                                   std::function<void()> handler) {
  if (stream == "com.orvex.beacond.matching") {
    sources_.push_back({queue, seeds_.observe("com.orvex.AppRegistry.DatabaseChange", queue, handler)});
  } else if (stream != "com.orvex.broadcastd.matching" && stream != "com.orvex.vigil.matching") {
    return log_.write("There is no launch-event stream " + std::string(stream));
  }
  queue.async(std::move(handler));
}

}  // namespace kel::platform
