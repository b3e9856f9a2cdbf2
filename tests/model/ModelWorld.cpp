#include "tests/model/ModelWorld.h"

#include <sys/xattr.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "applibraries/LocalAppLibraryCache.h"
#include "applibraries/LocalAppLibraryManager.h"
#include "items/LocalItem.h"
#include "platform/Tag.h"
#include "platform/apps/AppRecord.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "tests/common/AppLibraryTest.h"

namespace tamber::model {

namespace fs = std::filesystem;

uint64_t Rng::next() {
    uint64_t z = (state_ += 0x9E3779B97F4A7C15ull);
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ull;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBull;
    return z ^ (z >> 31);
}

namespace {

const std::vector<std::string> kApps = {"com.example.alpha", "com.example.beta"};

std::string readAll(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream out;
    out << in.rdbuf();
    return out.str();
}

std::map<std::string, std::string> attributesOf(const std::string& path) {
    std::map<std::string, std::string> out;
    char names[4096];
    ssize_t length = ::llistxattr(path.c_str(), names, sizeof names);
    for (ssize_t at = 0; at < length;) {
        std::string name(names + at);
        at += ssize_t(name.size()) + 1;
        char value[65536];
        ssize_t size = ::lgetxattr(path.c_str(), name.c_str(), value, sizeof value);
        out[name] = size < 0 ? "<unreadable>" : std::string(value, size_t(size));
    }
    return out;
}

const char* kindName(ModelNode::Kind kind) {
    switch (kind) {
        case ModelNode::Kind::File:
            return "file";
        case ModelNode::Kind::Folder:
            return "folder";
        case ModelNode::Kind::Link:
            return "link";
    }
    return "?";
}

std::string describe(const Replica& replica) {
    std::string out;
    for (const auto& [id, entry] : replica)
        out += "\n    " + id + " \"" + entry.filename + "\" in " + entry.parent;
    return out;
}

}  // namespace

ModelWorld::ModelWorld() : tree_({kStorage, kLibraryA, kLibraryB}) {
    if (const char* old = std::getenv("XDG_DATA_HOME"))
        oldDataHome_ = old;
    ::setenv("XDG_DATA_HOME", state_.makeDir("data").c_str(), 1);
    LocalAppLibraryManager::resetSharedForTesting();
    LocalAppLibraryCache::resetSharedForTesting();
    auto registry = std::make_shared<testing::FakeAppRegistry>();
    std::vector<BundleRecordRef> records;
    for (const auto& bundle : kApps) {
        std::string container = base_.makeDir("apps/" + bundle);
        fs::create_directories(container + "/Documents");
        BundleRecord::Fields fields{bundle, bundle + " app", Url::fileURLWithPath(container),
                                    std::nullopt};
        auto info = Dictionary::make({{"HostSupportsDocumentBrowser", Number::fromBool(true)}});
        records.push_back(AppRecord::make(fields, {false, false, info}));
    }
    registry->replace(AppRegistry::kUserApplications, records);
    oldRegistry_ = AppRegistry::setDefaultRegistry(registry);
    base_.makeDir(kStorage);
    host_ = std::make_unique<ModelHost>(full(kStorage), state_ / "journal");
}

ModelWorld::~ModelWorld() {
    host_.reset();
    LocalAppLibraryManager::resetSharedForTesting();
    LocalAppLibraryCache::resetSharedForTesting();
    AppRegistry::setDefaultRegistry(oldRegistry_);
    if (!oldDataHome_.empty())
        ::setenv("XDG_DATA_HOME", oldDataHome_.c_str(), 1);
    else
        ::unsetenv("XDG_DATA_HOME");
    // Folders a step made unreadable would keep the temporary folder from going.
    std::error_code ignored;
    for (auto it = fs::recursive_directory_iterator(base_.path(), ignored); it != fs::end(it);
         it.increment(ignored))
        if (it->is_directory(ignored) && !it->is_symlink(ignored))
            fs::permissions(it->path(), fs::perms::owner_all, fs::perm_options::add, ignored);
}

std::string ModelWorld::start() {
    std::string failed = host_->start();
    if (!failed.empty())
        return failed;
    return host_->relist();
}

std::string ModelWorld::relative(const std::string& absolute) const {
    const std::string& base = base_.path();
    if (absolute.size() <= base.size() + 1 || absolute.compare(0, base.size(), base) != 0 ||
        absolute[base.size()] != '/')
        return "";
    return absolute.substr(base.size() + 1);
}

std::string ModelWorld::identifierAt(const std::string& path) {
    auto item = LocalItem::make(Url::fileURLWithPath(full(path)));
    return item ? item->itemIdentifier() : "";
}

ModelWorld::Disk ModelWorld::readDisk() const {
    Disk disk;
    for (const auto& root : tree_.roots()) {
        disk[root] = {ModelNode::Kind::Folder, "", attributesOf(full(root))};
        std::error_code error;
        for (auto it = fs::recursive_directory_iterator(full(root), error); it != fs::end(it);
             it.increment(error)) {
            std::string path = relative(it->path().string());
            auto status = it->symlink_status(error);
            DiskEntry entry{ModelNode::Kind::File, "", attributesOf(it->path())};
            if (fs::is_symlink(status)) {
                entry.kind = ModelNode::Kind::Link;
                entry.contents = fs::read_symlink(it->path(), error).string();
            } else if (fs::is_directory(status)) {
                entry.kind = ModelNode::Kind::Folder;
            } else {
                entry.contents = readAll(it->path());
            }
            disk[path] = std::move(entry);
        }
    }
    return disk;
}

std::string ModelWorld::describeDifference(const Disk& before, const Disk& after) {
    std::string out;
    for (const auto& [path, entry] : before) {
        auto it = after.find(path);
        if (it == after.end())
            out += "\n  gone: " + path;
        else if (!(it->second == entry))
            out += "\n  changed: " + path;
    }
    // An empty trash folder made on the way is no change anyone sees.
    for (const auto& [path, entry] : after)
        if (!before.contains(path) && !(nameOf(path) == ".Trash" && entry.attributes.empty()))
            out += "\n  new: " + path;
    return out;
}

std::string ModelWorld::checkDiskAgainstModel(const Disk& disk) {
    std::string out;
    auto trashFolder = [&](const std::string& path) {
        return nameOf(path) == ".Trash" && tree_.isRoot(parentOf(path));
    };
    for (const auto& [path, entry] : disk) {
        if (trashFolder(path))
            continue;
        const ModelNode* node = tree_.find(path);
        if (!node)
            out += "\n  on disk, not in the model: " + path;
        else if (node->kind != entry.kind)
            out += "\n  " + path + " is a " + kindName(entry.kind) + ", the model has a " +
                   kindName(node->kind);
        else if (node->kind != ModelNode::Kind::Folder && node->contents != entry.contents)
            out += "\n  " + path + " holds \"" + entry.contents.substr(0, 40) + "\", the model \"" +
                   node->contents.substr(0, 40) + "\"";
    }
    for (const auto& [path, node] : tree_.nodes())
        if (!disk.contains(path))
            out += "\n  in the model, not on disk: " + path;
    return out;
}

Replica ModelWorld::diskView(std::map<std::string, std::string>& identifiers) {
    Replica view;
    for (const auto& bundle : kApps)
        view["#" + bundle] = {bundle + " app", HostPorterRootContainerItemIdentifier};
    auto add = [&](const fs::path& path) {
        auto item = LocalItem::make(Url::fileURLWithPath(path.string()));
        if (!item)
            return;
        view[item->itemIdentifier()] = {item->filename(), item->parentItemIdentifier()};
        identifiers[relative(path.string())] = item->itemIdentifier();
    };
    for (const auto& root : tree_.roots()) {
        std::error_code error;
        for (auto it = fs::recursive_directory_iterator(full(root), error); it != fs::end(it);
             it.increment(error)) {
            if (it->path().filename().string()[0] == '.') {
                it.disable_recursion_pending();
                continue;
            }
            add(it->path());
        }
        // The working set also holds the top level of each root's trash.
        for (auto it = fs::directory_iterator(full(root) + "/.Trash", error); it != fs::end(it);
             it.increment(error))
            if (it->path().filename().string()[0] != '.')
                add(it->path());
    }
    return view;
}

std::string ModelWorld::checkHost() {
    ModelHost& host = *host_;
    host.sync();
    std::string failed = host.catchUp();
    if (!failed.empty())
        return "\n  the host did not catch up: " + failed;
    std::map<std::string, std::string> identifiers;
    Replica disk = diskView(identifiers);
    std::string out;
    if (host.replica() != disk)
        out += "\n  the host's replica differs from the disk\n  host:" + describe(host.replica()) +
               "\n  disk:" + describe(disk);
    for (const auto& [path, identifier] : identifiers) {
        auto item = host.porter().itemForIdentifier(identifier);
        auto local = item.ok() ? std::dynamic_pointer_cast<const LocalItem>(item.value()) : nullptr;
        if (!local)
            out += "\n  " + identifier + " (" + path + ") does not resolve";
        else if (local->fileURL().path() != full(path))
            out +=
                "\n  " + identifier + " resolves to " + local->fileURL().path() + ", not " + path;
        ModelNode* node = tree_.find(path);
        if (!node)
            continue;
        if (node->identifier.empty())
            node->identifier = identifier;
        else if (node->identifier != identifier)
            out += "\n  " + path + " was " + node->identifier + " and is now " + identifier;
        if (!local)
            continue;
        std::vector<std::string> labels;
        if (auto tags = GetTagsFromTagsData(local->tagData().value_or(Bytes{})))
            for (const auto& tag : *tags) labels.push_back(tag->label());
        std::optional<uint64_t> rank;
        if (local->favoriteRank())
            rank = local->favoriteRank()->uint64Value();
        if (labels != node->tags || rank != node->rank || local->isTrashed() != node->trashed)
            out += "\n  " + path + "'s metadata differs from the model (tags " +
                   std::to_string(labels.size()) + "/" + std::to_string(node->tags.size()) +
                   ", rank " + (rank ? std::to_string(*rank) : "-") + "/" +
                   (node->rank ? std::to_string(*node->rank) : "-") + ", trashed " +
                   std::to_string(local->isTrashed()) + "/" + std::to_string(node->trashed) + ")";
    }
    return out;
}

std::string ModelWorld::check() {
    host_->faults().clearInjections();
    std::string out = checkDiskAgainstModel(readDisk());
    out += checkHost();
    return out;
}

}  // namespace tamber::model
