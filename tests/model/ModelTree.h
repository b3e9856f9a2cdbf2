#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace tamber::model {

// What the disk should hold, kept by the model test beside the real tree: every entry of the
// published trees (the storage folder and two app libraries, their trash included) by its path
// relative to the test's base folder, with what a user could see of it.
struct ModelNode {
    enum class Kind { File, Folder, Link };
    Kind kind = Kind::File;
    std::string contents;  // a file's bytes, a link's target
    std::vector<std::string> tags;
    std::optional<uint64_t> rank;
    bool trashed = false;  // the top of a trashed tree
    std::string putBack;   // a trashed tree's folder before, for put-back
    // Trashed while a file-system call failed: it may have no trash date, and then the next
    // sweep dates it instead of deleting it.
    bool mayLackTrashDate = false;
    // The identifier the provider gave the entry the first time it was checked; empty before.
    std::string identifier;
    friend bool operator==(const ModelNode&, const ModelNode&) = default;

    static ModelNode file(std::string contents) { return make(Kind::File, std::move(contents)); }
    static ModelNode folder() { return make(Kind::Folder, ""); }
    static ModelNode link(std::string target) { return make(Kind::Link, std::move(target)); }
    static ModelNode make(Kind kind, std::string contents) {
        ModelNode node;
        node.kind = kind;
        node.contents = std::move(contents);
        return node;
    }
};

class ModelTree {
public:
    using Nodes = std::map<std::string, ModelNode>;

    // The published roots, relative to the base folder: the storage folder first.
    explicit ModelTree(std::vector<std::string> roots);

    const std::vector<std::string>& roots() const { return roots_; }
    const Nodes& nodes() const { return nodes_; }
    ModelNode* find(const std::string& path);
    bool contains(const std::string& path) const { return nodes_.contains(path); }

    void add(const std::string& path, ModelNode node);
    // Removes `path` and everything under it.
    void removeTree(const std::string& path);
    // Moves `from` and everything under it to `to`.
    void moveTree(const std::string& from, const std::string& to);

    // The root that holds `path` ("" when none); whether `path` is a root itself.
    std::string rootOf(const std::string& path) const;
    bool isRoot(const std::string& path) const;
    // Whether `path` lies in a root's trash (".Trash" and below).
    bool inTrash(const std::string& path) const;

    // Paths of the entries that pass `keep`, in a stable order, for picking by index.
    template <class Keep>
    std::vector<std::string> select(Keep keep) const {
        std::vector<std::string> out;
        for (const auto& [path, node] : nodes_)
            if (keep(path, node))
                out.push_back(path);
        return out;
    }

private:
    std::vector<std::string> roots_;
    Nodes nodes_;
};

// Path helpers on '/'-separated relative paths.
std::string parentOf(const std::string& path);
std::string nameOf(const std::string& path);
bool isUnder(const std::string& path, const std::string& ancestor);  // strictly below

}  // namespace tamber::model
