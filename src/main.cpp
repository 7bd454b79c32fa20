#include <iostream>
#include <string>
#include <vector>

#include "client/command_line.h"
#include "common/common.h"
#include "platform/linux/linux_platform.h"
#include "server/run_as_server.h"

int main(int argc, char** argv) {
  kel::platform::LinuxPlatform linuxPlatform;
  kel::platform::Platform& platform = linuxPlatform.platform();
  if (kel::running_from_launcher(platform.facts)) return kel::run_as_server(platform);
  return kel::parse_arguments(std::vector<std::string>(argv, argv + argc), platform, std::cout);
}
