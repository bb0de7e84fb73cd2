// StoreRoot: a fresh directory (mkdtemp under /tmp) to serve as a local store's root, with the
// bucket directory "rec" in it; removed with everything below it at destruction. One thread.
#pragma once

#include <stdlib.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

namespace testsupport {

class StoreRoot {
  public:
    StoreRoot() { std::filesystem::create_directory(root_ + "/rec"); }
    ~StoreRoot() {
        std::error_code ignored;
        std::filesystem::remove_all(root_, ignored);
    }
    StoreRoot(const StoreRoot&) = delete;
    StoreRoot& operator=(const StoreRoot&) = delete;

    const std::string& Root() const { return root_; }
    // Path of a key in the bucket "rec".
    std::string Path(const std::string& key) const { return root_ + "/rec/" + key; }
    // Every regular file below the root, sorted.
    std::vector<std::string> Files() const {
        std::vector<std::string> files;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(root_))
            if (entry.is_regular_file()) files.push_back(entry.path().string());
        std::sort(files.begin(), files.end());
        return files;
    }
    // The names in a directory, sorted (none when it does not exist).
    static std::vector<std::string> Entries(const std::string& directory) {
        std::vector<std::string> names;
        std::error_code missing;
        for (const auto& e : std::filesystem::directory_iterator(directory, missing))
            names.push_back(e.path().filename().string());
        std::sort(names.begin(), names.end());
        return names;
    }

  private:
    std::string root_ = [] {
        char templ[] = "/tmp/sfr-store-XXXXXX";
        return std::string(mkdtemp(templ));
    }();
};

}  // namespace testsupport
