#include "app/SingleInstance.h"

#include "core/Text.h"
#include "platform/Platform.h"

namespace kesu {

int countProcessLines(std::string_view processList, std::string_view name) {
    int count = 0;
    std::size_t start = 0;
    while (start <= processList.size()) {
        std::size_t end = processList.find('\n', start);
        if (end == std::string_view::npos) end = processList.size();
        std::string_view line = processList.substr(start, end - start);
        if (text::contains(line, name) && !text::contains(line, "grep")) ++count;
        start = end + 1;
    }
    return count;
}

bool processName(const std::string& name) {
    const auto list = Platform::current().processList();
    if (!list || !text::isValidUtf8(*list)) return true;  // unreadable: as if alone
    return countProcessLines(*list, name) != 2;
}

}  // namespace kesu
