// The platform layer on Linux: sysfs, getifaddrs, /proc and a few standard commands.
#pragma once

#include <memory>

#include "platform/Platform.h"

namespace kesu {

std::unique_ptr<Platform> makeLinuxPlatform();

}  // namespace kesu
