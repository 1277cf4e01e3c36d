// The two built-in steps catalogues: JSON objects mapping an entry key to the step's short
// code, its description and the numeric results it can end with.
#pragma once

#include <string_view>

namespace kesu {

// Connection steps of the Bluetooth and LAN connections started by the PC.
extern const std::string_view stepsConfig;
// Steps of pre-connections and of connections over a pre-connection.
extern const std::string_view os4StepsConfig;

}  // namespace kesu
