#pragma once

#include <memory>
#include <string>

#include "platform/ScopedFd.h"

namespace tamber {

// A folder held open while its children are read: the children's status, access checks and
// attribute lists are then read relative to its descriptor, one name lookup each instead of a
// walk of the whole path. Made by whoever opened the folder; a Url made in it keeps only a weak
// reference, so that a listing's items never hold descriptors after the listing ends.
class OpenFolder {
public:
    // `fd` is an open descriptor of the folder at `path` (absolute, standardised). `linkFree`
    // says that no symbolic link was followed below the folder's published root on the way to
    // it, which its opener checked.
    OpenFolder(std::string path, ScopedFd fd, bool linkFree)
        : path_(std::move(path)), fd_(std::move(fd)), linkFree_(linkFree) {}

    const std::string& path() const { return path_; }
    int fd() const { return fd_.get(); }
    bool linkFree() const { return linkFree_; }

private:
    const std::string path_;
    const ScopedFd fd_;
    const bool linkFree_;
};

using OpenFolderRef = std::shared_ptr<const OpenFolder>;

}  // namespace tamber
