// The single-instance check of the service at start.
#pragma once

#include <string>
#include <string_view>

namespace kesu {

// Lines of a process list that name `name` and are not a grep of it.
int countProcessLines(std::string_view processList, std::string_view name);

// True when the caller may go on starting; false when another instance already runs
// (exactly two matching lines in `ps -A`: the other instance and this one).
bool processName(const std::string& name);

}  // namespace kesu
