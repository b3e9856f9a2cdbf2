#pragma once

#include <string>

namespace tamber::testing {

// A fresh directory under $TMPDIR (or /tmp), removed with its contents on destruction.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& path() const { return path_; }
    // path() + "/" + relative
    std::string operator/(const std::string& relative) const { return path_ + "/" + relative; }
    // Writes `contents` to `relative`, creating parent folders; returns the full path.
    std::string writeFile(const std::string& relative, const std::string& contents = "") const;
    std::string makeDir(const std::string& relative) const;

private:
    std::string path_;
};

}  // namespace tamber::testing
