// StoreRoot: a fresh directory (mkdtemp under /tmp) to serve as a local store's root, with the
// bucket directory "rec" in it; removed with everything below it at destruction. One thread.
#pragma once

#include <string>
#include <vector>

namespace testsupport {

class StoreRoot {
  public:
    StoreRoot();
    ~StoreRoot();
    StoreRoot(const StoreRoot&) = delete;
    StoreRoot& operator=(const StoreRoot&) = delete;

    const std::string& Root() const { return root_; }
    // Path of a key in the bucket "rec".
    std::string Path(const std::string& key) const { return root_ + "/rec/" + key; }
    // Every regular file below the root, sorted.
    std::vector<std::string> Files() const;
    // The names in a directory, sorted (none when it does not exist).
    static std::vector<std::string> Entries(const std::string& directory);

  private:
    std::string root_;
};

}  // namespace testsupport
