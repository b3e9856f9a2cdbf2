#include "tests/model/ModelSteps.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "items/LocalItem.h"
#include "platform/Tag.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"

namespace tamber::model {

namespace fs = std::filesystem;
using Kind = ModelNode::Kind;

namespace {

const std::vector<std::string> kFileNames = {"a.txt",     "b.txt", "Notes.md", "report 1.pdf",
                                             "photo.png", "x",     "é.txt",    "a b c.txt"};
const std::vector<std::string> kFolderNames = {"Work", "Old", "Projects", "d", "Ünïcode"};
const std::vector<std::string> kLabels = {"Red", "Work", "Travel", "Later"};

void writeFile(const std::string& path, const std::string& contents, bool append = false) {
    std::ofstream(path, append ? std::ios::binary | std::ios::app : std::ios::binary) << contents;
}

// Whether `name` is `wanted` or a bounce of it ("a 2.txt" for "a.txt").
bool isBounceOf(const std::string& name, const std::string& wanted) {
    if (name == wanted)
        return true;
    auto dot = wanted.rfind('.');
    std::string stem = dot == std::string::npos || dot == 0 ? wanted : wanted.substr(0, dot);
    std::string ext = stem.size() == wanted.size() ? "" : wanted.substr(stem.size());
    if (name.size() <= stem.size() + ext.size() + 1 || name.compare(0, stem.size(), stem) != 0 ||
        name[stem.size()] != ' ' || name.compare(name.size() - ext.size(), ext.size(), ext) != 0)
        return false;
    std::string number = name.substr(stem.size() + 1, name.size() - ext.size() - stem.size() - 1);
    return !number.empty() && number.find_first_not_of("0123456789") == std::string::npos;
}

std::string expectPlace(const std::string& path, const std::string& parent,
                        const std::string& wanted) {
    if (parentOf(path) != parent)
        return "\n  it went to " + path + ", not into " + parent;
    if (!isBounceOf(nameOf(path), wanted))
        return "\n  it is named \"" + nameOf(path) + "\", not \"" + wanted + "\" or a bounce of it";
    return "";
}

}  // namespace

std::vector<std::string> ModelSteps::folders(bool withRoots) const {
    const ModelTree& tree = world_.tree();
    return tree.select([&](const std::string& path, const ModelNode& node) {
        return node.kind == Kind::Folder && !tree.inTrash(path) &&
               (withRoots || !tree.isRoot(path));
    });
}

std::vector<std::string> ModelSteps::entries() const {
    const ModelTree& tree = world_.tree();
    return tree.select([&](const std::string& path, const ModelNode&) {
        return !tree.isRoot(path) && !tree.inTrash(path);
    });
}

std::vector<std::string> ModelSteps::files() const {
    const ModelTree& tree = world_.tree();
    return tree.select([&](const std::string& path, const ModelNode& node) {
        return node.kind == Kind::File && !tree.inTrash(path);
    });
}

std::vector<std::string> ModelSteps::trashed() const {
    return world_.tree().select(
        [](const std::string&, const ModelNode& node) { return node.trashed; });
}

std::string ModelSteps::identifier(const std::string& path) {
    // The storage folder is the root container; a library root is its app's item.
    if (path == ModelWorld::kStorage)
        return HostPorterRootContainerItemIdentifier;
    if (world_.tree().isRoot(path))
        return "#" + nameOf(parentOf(path));
    ModelNode* node = world_.tree().find(path);
    if (node && !node->identifier.empty())
        return node->identifier;
    return world_.identifierAt(path);
}

void ModelSteps::forgetRemoved(const std::string& path) {
    ModelTree& tree = world_.tree();
    for (const auto& entry : tree.select([&](const std::string&p, const ModelNode&) {
             return p == path || isUnder(p, path);
         })) {
        std::error_code error;
        if (tree.contains(entry) && !fs::exists(fs::symlink_status(world_.full(entry), error)))
            tree.removeTree(entry);
    }
}

std::string ModelSteps::pathOf(const Result<HostPorterItemRef>& item) const {
    auto local = item.ok() ? std::dynamic_pointer_cast<const LocalItem>(item.value()) : nullptr;
    return local ? world_.relative(local->fileURL().path()) : "";
}

const std::vector<std::string>& ModelSteps::families() {
    static const std::vector<std::string> names = {"together", "fault", "overflow", "restart"};
    return names;
}

bool ModelSteps::skipped(const std::string& family) const {
    return std::find(skipped_.begin(), skipped_.end(), family) != skipped_.end();
}

std::string ModelSteps::run(uint64_t seed, uint64_t index, std::string& description) {
    Rng rng(seed, index);
    if (!world_.host().running()) {
        std::string failed = world_.host().start();
        if (!failed.empty())
            return "\n  the host did not start again: " + failed;
    }
    unsigned roll = unsigned(rng.below(100));
    if (roll < 40 || (roll >= 75 && roll < 85 && skipped("together")) ||
        (roll >= 85 && roll < 91 && skipped("fault")) ||
        (roll >= 91 && roll < 96 && skipped("overflow")) || (roll >= 96 && skipped("restart")))
        return outsideChange(rng, description);
    if (roll < 75) {
        Operation operation = planOperation(rng);
        description = operation.description;
        return runOne(std::move(operation), false);
    }
    if (roll < 85) {
        std::vector<Operation> operations;
        size_t wanted = 2 + rng.below(2);
        for (int tries = 0; tries < 10 && operations.size() < wanted; ++tries) {
            Operation next = planOperation(rng);
            bool apart = true;
            for (const auto& other : operations)
                for (const auto& a : other.involved)
                    for (const auto& b : next.involved)
                        if (a == b || isUnder(a, b) || isUnder(b, a))
                            apart = false;
            if (apart && next.start)
                operations.push_back(std::move(next));
        }
        description = "at once:";
        for (const auto& operation : operations) description += " [" + operation.description + "]";
        return runTogether(std::move(operations));
    }
    if (roll < 91)
        return fault(rng, description);
    if (roll < 96)
        return overflow(rng, description);
    return restart(rng, description);
}

std::string ModelSteps::outsideChange(Rng& rng, std::string& description) {
    ModelTree& tree = world_.tree();
    const std::string contents = "contents " + std::to_string(++counter_) + "\n";
    switch (rng.below(12)) {
        case 0:
        case 1: {  // create a file
            std::string path = rng.pick(folders(true)) + "/" + rng.pick(kFileNames);
            description = "outside: create " + path;
            if (tree.contains(path))
                return "";
            writeFile(world_.full(path), contents);
            tree.add(path, ModelNode::file(contents));
            return "";
        }
        case 2: {  // append, or truncate
            auto all = files();
            if (all.empty())
                return "";
            std::string path = rng.pick(all);
            ModelNode& node = *tree.find(path);
            if (rng.chance(70)) {
                description = "outside: append to " + path;
                writeFile(world_.full(path), contents, true);
                node.contents += contents;
            } else {
                size_t length = node.contents.size() / 2;
                description = "outside: truncate " + path + " to " + std::to_string(length);
                if (::truncate(world_.full(path).c_str(), off_t(length)) != 0)
                    return "\n  truncate failed";
                node.contents.resize(length);
            }
            return "";
        }
        case 3: {  // safe save: a new file renamed over the old one
            auto all = files();
            if (all.empty())
                return "";
            std::string path = rng.pick(all);
            description = "outside: safe save of " + path;
            std::string temporary = world_.full(parentOf(path)) + "/.saving-" + nameOf(path);
            writeFile(temporary, contents);
            if (::rename(temporary.c_str(), world_.full(path).c_str()) != 0)
                return "\n  the safe save's rename failed";
            tree.find(path)->contents = contents;
            return "";
        }
        case 4:
        case 5: {  // rename in place, or move across folders and roots
            auto all = entries();
            if (all.empty())
                return "";
            std::string from = rng.pick(all);
            std::string folder = rng.chance(50) ? parentOf(from) : rng.pick(folders(true));
            const ModelNode& node = *tree.find(from);
            std::string name =
                rng.chance(50) ? nameOf(from)
                               : rng.pick(node.kind == Kind::Folder ? kFolderNames : kFileNames);
            std::string to = folder + "/" + name;
            description = "outside: move " + from + " to " + to;
            if (tree.contains(to) || to == from || isUnder(to, from))
                return "";
            if (::rename(world_.full(from).c_str(), world_.full(to).c_str()) != 0)
                return "\n  rename failed: " + std::string(std::strerror(errno));
            tree.moveTree(from, to);
            return "";
        }
        case 6:
        case 7: {  // delete a file or link, or a whole folder tree
            auto all = entries();
            if (all.empty())
                return "";
            std::string path = rng.pick(all);
            description = "outside: delete " + path;
            std::error_code error;
            fs::remove_all(world_.full(path), error);
            if (error)
                return "\n  delete failed: " + error.message();
            tree.removeTree(path);
            return "";
        }
        case 8: {  // a deep tree
            std::string path = rng.pick(folders(true));
            description = "outside: deep tree under " + path;
            for (int depth = 0; depth < 4; ++depth) {
                path += "/" + rng.pick(kFolderNames);
                if (tree.contains(path) && tree.find(path)->kind != Kind::Folder)
                    return "";
                if (!tree.contains(path)) {
                    fs::create_directory(world_.full(path));
                    tree.add(path, ModelNode::folder());
                }
            }
            path += "/" + rng.pick(kFileNames);
            const ModelNode* there = tree.find(path);
            if (there && there->kind != Kind::File)
                return "";
            writeFile(world_.full(path), contents);
            if (there)  // written over in place: the file keeps its metadata
                tree.find(path)->contents = contents;
            else
                tree.add(path, ModelNode::file(contents));
            return "";
        }
        case 9: {  // a symbolic link, inside the tree or pointing out of it
            std::string path = rng.pick(folders(true)) + "/link " + std::to_string(counter_);
            std::string target = rng.chance(50) ? "../../../../../../etc/passwd"
                                                : (rng.chance(50) ? "/etc" : "a.txt");
            description = "outside: link " + path + " to " + target;
            if (::symlink(target.c_str(), world_.full(path).c_str()) != 0)
                return "\n  symlink failed";
            tree.add(path, ModelNode::link(target));
            return "";
        }
        default: {  // the desktop's tag list, written by another program
            auto all = entries();
            if (all.empty())
                return "";
            std::string path = rng.pick(all);
            ModelNode& node = *tree.find(path);
            if (node.kind == Kind::Link)
                return "";
            std::vector<std::string> labels;
            for (const auto& label : kLabels)
                if (rng.chance(40))
                    labels.push_back(label);
            std::string list;
            for (const auto& label : labels) list += (list.empty() ? "" : ",") + label;
            description = "outside: tag list \"" + list + "\" on " + path;
            if (::setxattr(world_.full(path).c_str(), "user.xdg.tags", list.data(), list.size(),
                           0) != 0)
                return "\n  setxattr failed";
            node.tags = labels;
            return "";
        }
    }
}

ModelSteps::Operation ModelSteps::planOperation(Rng& rng) {
    ModelTree& tree = world_.tree();
    LocalPorter& porter = world_.host().porter();
    Operation op;
    auto pickEntry = [&](std::string& path) {
        auto all = entries();
        if (all.empty())
            return false;
        path = rng.pick(all);
        return true;
    };
    switch (rng.below(11)) {
        case 0: {  // import a document from outside
            std::string parent = rng.pick(folders(true));
            std::string name = rng.pick(kFileNames);
            std::string source = world_.outside() + "/" + std::to_string(++counter_) + "/" + name;
            fs::create_directories(parentOf(source));
            std::string contents = "imported " + std::to_string(counter_) + "\n";
            writeFile(source, contents);
            op.description = "import " + name + " into " + parent;
            op.involved = {parent};
            std::string parentID = identifier(parent);
            op.start = [&porter, source, parentID](auto done) {
                porter.importDocumentAtURL(Url::fileURLWithPath(source), parentID, done);
            };
            op.apply = [&tree, parent, name, contents](const std::string& path) {
                tree.add(path, ModelNode::file(contents));
                return expectPlace(path, parent, name);
            };
            op.mayFail = tree.isRoot(parent);
            return op;
        }
        case 1: {  // create a folder
            std::string parent = rng.pick(folders(true));
            std::string name = rng.pick(kFolderNames);
            bool bounce = rng.chance(60);
            op.description = std::string("create folder ") + name + " in " + parent +
                             (bounce ? "" : " without bouncing");
            op.involved = {parent};
            std::string parentID = identifier(parent);
            op.start = [&porter, name, parentID, bounce](auto done) {
                porter.createDirectoryWithName(name, parentID, bounce, done);
            };
            op.apply = [&tree, parent, name](const std::string& path) {
                tree.add(path, ModelNode::folder());
                return expectPlace(path, parent, name);
            };
            op.mayFail = !bounce || tree.isRoot(parent);
            return op;
        }
        case 2:
        case 3: {  // rename, or move (with or without a new name)
            std::string from;
            if (!pickEntry(from))
                return op;
            bool move = rng.chance(50);
            std::string parent = move ? rng.pick(folders(true)) : parentOf(from);
            std::string name =
                rng.chance(50)
                    ? nameOf(from)
                    : rng.pick(tree.find(from)->kind == Kind::Folder ? kFolderNames : kFileNames);
            if (parent == from || isUnder(parent, from))
                return op;
            op.description = (move ? "move " : "rename ") + from + " to " + parent + "/" + name;
            op.involved = {from, parent};
            std::string id = identifier(from);
            std::string parentID = identifier(parent);
            bool keepName = rng.chance(50) && name == nameOf(from);
            if (move)
                op.start = [&porter, id, parentID, name, keepName](auto done) {
                    porter.reparentItemWithIdentifier(
                        id, parentID, keepName ? std::nullopt : std::optional(name), done);
                };
            else
                op.start = [&porter, id, name](auto done) {
                    porter.renameItemWithIdentifier(id, name, done);
                };
            op.apply = [&tree, from, parent, name](const std::string& path) {
                tree.moveTree(from, path);
                return expectPlace(path, parent, name);
            };
            // A taken name may be refused rather than bounced.
            op.mayFail = tree.contains(parent + "/" + name) && parent + "/" + name != from;
            return op;
        }
        case 4: {  // trash
            std::string from;
            if (!pickEntry(from))
                return op;
            op.description = "trash " + from;
            op.involved = {from, tree.rootOf(from) + "/.Trash"};
            std::string id = identifier(from);
            op.start = [&porter, id](auto done) { porter.trashItemWithIdentifier(id, done); };
            op.apply = [this, &tree, from](const std::string& path) {
                tree.moveTree(from, path);
                ModelNode& node = *tree.find(path);
                node.trashed = true;
                // A link can keep no put-back attribute, and a failed attribute write leaves
                // the item trashed without one: where it goes back to is then not known.
                node.putBack = faulted_ || node.kind == Kind::Link ? "" : parentOf(from);
                node.mayLackTrashDate = faulted_;
                return expectPlace(path, tree.rootOf(from) + "/.Trash", nameOf(from));
            };
            return op;
        }
        case 5: {  // put back, where it was or somewhere given
            auto all = trashed();
            if (all.empty())
                return op;
            std::string from = rng.pick(all);
            std::optional<std::string> destination;
            if (rng.chance(30))
                destination = rng.pick(folders(false).empty() ? folders(true) : folders(false));
            op.description = "put back " + from + (destination ? " into " + *destination : "");
            op.involved = {from};
            if (destination)
                op.involved.push_back(*destination);
            std::string id = identifier(from);
            std::optional<std::string> destinationID;
            if (destination)
                destinationID = identifier(*destination);
            op.start = [&porter, id, destinationID](auto done) {
                porter.untrashItemWithIdentifier(id, destinationID, done);
            };
            std::string putBack = tree.find(from)->putBack;
            if (!destination && !putBack.empty())
                op.involved.push_back(putBack);
            std::string expected = destination       ? *destination
                                   : putBack.empty() ? ""
                                   : tree.contains(putBack) && !tree.inTrash(putBack)
                                       ? putBack
                                       : tree.rootOf(from);
            op.apply = [&tree, from, expected](const std::string& path) {
                tree.moveTree(from, path);
                ModelNode& node = *tree.find(path);
                node.trashed = false;
                node.putBack.clear();
                if (expected.empty())
                    return tree.inTrash(path) ? "\n  it stayed in the trash: " + path
                                              : std::string();
                return expectPlace(path, expected, nameOf(from));
            };
            return op;
        }
        case 6: {  // delete, from the tree or from the trash
            std::string path;
            auto gone = trashed();
            if (!gone.empty() && rng.chance(30))
                path = rng.pick(gone);
            else if (!pickEntry(path))
                return op;
            op.description = "delete " + path;
            op.involved = {path};
            op.partial = true;
            std::string id = identifier(path);
            op.start = [&porter, id](auto done) {
                porter.deleteItemWithIdentifier(id, [done](Status status) {
                    if (status.ok())
                        done(HostPorterItemRef(nullptr));
                    else
                        done(status.error());
                });
            };
            op.apply = [&tree, path](const std::string&) {
                tree.removeTree(path);
                return std::string();
            };
            return op;
        }
        case 7: {  // tags
            std::string path;
            if (!pickEntry(path))
                return op;
            std::vector<std::string> labels;
            std::vector<std::shared_ptr<const Tag>> tags;
            for (const auto& label : kLabels)
                if (rng.chance(40)) {
                    labels.push_back(label);
                    tags.push_back(Tag::make(label, int64_t(rng.below(8))));
                }
            op.description = "set " + std::to_string(labels.size()) + " tags on " + path;
            op.involved = {path};
            std::string id = identifier(path);
            std::optional<Bytes> data;
            if (!tags.empty() || rng.chance(50))
                data = GetTagsDataForTags(tags);
            op.start = [&porter, id, data](auto done) { porter.setTagData(data, id, done); };
            op.apply = [&tree, path, labels](const std::string&) {
                tree.find(path)->tags = labels;
                return std::string();
            };
            op.mayFail = tree.find(path)->kind == Kind::Link;
            return op;
        }
        case 8:
        case 9: {  // favourite rank, or last-used date
            std::string path;
            if (!pickEntry(path))
                return op;
            op.involved = {path};
            std::string id = identifier(path);
            op.mayFail = tree.find(path)->kind == Kind::Link;
            if (rng.chance(50)) {
                std::optional<uint64_t> rank;
                if (rng.chance(75))
                    rank = 1 + rng.below(1000);
                op.description = "rank " + path + " " + (rank ? std::to_string(*rank) : "none");
                auto number = rank ? Number::fromUInt64(*rank) : nullptr;
                op.start = [&porter, id, number](auto done) {
                    porter.setFavoriteRank(number, id, done);
                };
                op.apply = [&tree, path, rank](const std::string&) {
                    tree.find(path)->rank = rank;
                    return std::string();
                };
            } else {
                op.description = "last used " + path;
                op.start = [&porter, id](auto done) {
                    porter.setLastUsedDate(Date::now(), id, done);
                };
                op.apply = [](const std::string&) { return std::string(); };
            }
            return op;
        }
        default: {  // purge the trash: everything, or only what is old (nothing here is)
            bool everything = rng.chance(50);
            op.description = everything ? "purge the trash" : "purge old trash";
            op.involved = trashed();
            std::vector<std::string> before = op.involved;
            // Not beside anything that puts items in or takes them out of a trash.
            for (const auto& root : tree.roots()) op.involved.push_back(root + "/.Trash");
            auto date =
                Date::make(Date::now()->timeIntervalSince1970() + (everything ? 3600 : -3600));
            op.start = [&porter, date](auto done) {
                porter.removeTrashedItemsOlderThanDate(
                    date, [done](size_t) { done(HostPorterItemRef(nullptr)); });
            };
            // Only what was in the trash before: an operation beside it may trash more.
            op.apply = [this, &tree, everything, before](const std::string&) {
                std::string out;
                if (!everything)
                    return out;
                for (const auto& path : before) {
                    if (!tree.contains(path))
                        continue;
                    std::error_code error;
                    if (!fs::exists(fs::symlink_status(world_.full(path), error))) {
                        tree.removeTree(path);
                        continue;
                    }
                    // A failing call may leave part of any, and may have kept one without a
                    // date from being dated.
                    if (faulted_) {
                        forgetRemoved(path);
                        continue;
                    }
                    // One that may have had no date is dated now, deleted by the next sweep.
                    if (!std::exchange(tree.find(path)->mayLackTrashDate, false))
                        out += "\n  still in the trash: " + path;
                }
                return out;
            };
            return op;
        }
    }
}

}  // namespace tamber::model
