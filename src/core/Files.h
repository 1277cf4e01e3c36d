// Small text files: configuration the service reads whole.
#pragma once

#include <string>

namespace kesu {

class Files {
public:
    // True when the path exists; a missing file is logged.
    static bool isFileExist(const std::string& filePath);
    // Reads a whole UTF-8 text file of at most 16 MiB into `fileContent`; on any failure the
    // content is left as it was and the failure is logged.
    static void readFile(const std::string& filePath, std::string& fileContent);
};

}  // namespace kesu
