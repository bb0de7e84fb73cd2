#include "tests/support/StoreRoot.h"

#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>

namespace testsupport {

StoreRoot::StoreRoot() {
    char templ[] = "/tmp/sfr-store-XXXXXX";
    root_ = mkdtemp(templ);
    mkdir((root_ + "/rec").c_str(), 0755);
}

StoreRoot::~StoreRoot() {
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
}

std::vector<std::string> StoreRoot::Files() const {
    std::vector<std::string> files;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root_))
        if (entry.is_regular_file()) files.push_back(entry.path().string());
    std::sort(files.begin(), files.end());
    return files;
}

std::vector<std::string> StoreRoot::Entries(const std::string& directory) {
    std::vector<std::string> names;
    std::error_code missing;
    for (const auto& e : std::filesystem::directory_iterator(directory, missing))
        names.push_back(e.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
}

}  // namespace testsupport
