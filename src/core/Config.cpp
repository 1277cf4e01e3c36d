#include "core/Config.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>

namespace kesu {

Config& Config::current() {
    static Config* config = new Config();
    return *config;
}

std::string rootedPath(const std::string& absolutePath) {
    const char* root = std::getenv("KESU_ROOT");
    if (root == nullptr || *root == '\0') return absolutePath;
    std::string base(root);
    while (!base.empty() && base.back() == '/') base.pop_back();
    if (absolutePath.empty() || absolutePath.front() != '/') return base + "/" + absolutePath;
    return base + absolutePath;
}

std::string homeDirectory() {
    const char* home = std::getenv("HOME");
    if (home != nullptr && *home != '\0') return home;
    if (const passwd* pw = getpwuid(getuid()); pw != nullptr && pw->pw_dir != nullptr) return pw->pw_dir;
    return "/";
}

}  // namespace kesu
