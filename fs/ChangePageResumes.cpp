#include "fs/ChangePageResumes.h"
#include "support/MutexLock.h"

#include "support/ProcessWide.h"

namespace tamber {

ChangePageResumes& ChangePageResumes::shared() {
    static ProcessWide<ChangePageResumes> resumes;  // used by readers until the process ends
    return *resumes;
}

std::string ChangePageResumes::keyFor(const FSChangeToken& token,
                                      const HostPorterItemIdentifier& container,
                                      const std::vector<Url>& urls) {
    std::string key = token.deviceUUID + '\0' + std::to_string(token.streamEventID) + '\0' +
                      std::to_string(token.offset) + '\0' + container;
    for (const Url& url : urls) key += '\0' + url.path();
    return key;
}

void ChangePageResumes::keep(std::string key, Point point) {
    MutexLock lock(mutex_);
    points_.emplace_front(std::move(key), point);
    if (points_.size() > kMaxPoints)
        points_.pop_back();
}

std::optional<ChangePageResumes::Point> ChangePageResumes::take(const std::string& key) {
    MutexLock lock(mutex_);
    for (auto it = points_.begin(); it != points_.end(); ++it) {
        if (it->first == key) {
            Point point = it->second;
            points_.erase(it);
            return point;
        }
    }
    return std::nullopt;
}

}  // namespace tamber
