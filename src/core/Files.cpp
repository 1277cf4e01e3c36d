#include "core/Files.h"

#include <filesystem>
#include <fstream>
#include <sstream>

#include "core/Log.h"
#include "core/Text.h"

namespace kesu {

namespace fs = std::filesystem;

namespace {

// Files larger than this are not read into memory as configuration text.
constexpr std::uintmax_t maxReadFileSize = 16u << 20;

}  // namespace

bool Files::isFileExist(const std::string& filePath) {
    std::error_code ec;
    if (fs::exists(filePath, ec)) return true;
    Log::mPrintlog("[Files::isFileExist] config " + filePath + " is not exist ...");
    return false;
}

void Files::readFile(const std::string& filePath, std::string& fileContent) {
    std::error_code ec;
    if (!fs::exists(filePath, ec)) {
        Log::mPrintlog("[Files::readFile] file is not exist ...");
        return;
    }
    const auto size = fs::file_size(filePath, ec);
    std::ifstream in(filePath, std::ios::binary);
    std::string text;
    if (!ec && size <= maxReadFileSize && in) {
        std::ostringstream buffer;
        buffer << in.rdbuf();
        if (!in.bad()) text = buffer.str();
        else ec = std::make_error_code(std::errc::io_error);
    }
    if (ec || size > maxReadFileSize || !in || !text::isValidUtf8(text)) {
        Log::mPrintlog("[Files::readFile] config file exist but read fail");
        return;
    }
    fileContent = std::move(text);
    Log::mPrintlog("[Files::readFile] config file exist and content is: " + fileContent);
}

}  // namespace kesu
