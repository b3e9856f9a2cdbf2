#include "tests/model/ModelTree.h"

namespace tamber::model {

std::string parentOf(const std::string& path) {
    auto slash = path.rfind('/');
    return slash == std::string::npos ? "" : path.substr(0, slash);
}

std::string nameOf(const std::string& path) {
    auto slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

bool isUnder(const std::string& path, const std::string& ancestor) {
    return path.size() > ancestor.size() && path.compare(0, ancestor.size(), ancestor) == 0 &&
           path[ancestor.size()] == '/';
}

ModelTree::ModelTree(std::vector<std::string> roots) : roots_(std::move(roots)) {
    for (const auto& root : roots_) nodes_[root] = ModelNode::folder();
}

ModelNode* ModelTree::find(const std::string& path) {
    auto it = nodes_.find(path);
    return it == nodes_.end() ? nullptr : &it->second;
}

void ModelTree::add(const std::string& path, ModelNode node) {
    nodes_[path] = std::move(node);
}

void ModelTree::removeTree(const std::string& path) {
    for (auto it = nodes_.begin(); it != nodes_.end();) {
        if (it->first == path || isUnder(it->first, path))
            it = nodes_.erase(it);
        else
            ++it;
    }
}

void ModelTree::moveTree(const std::string& from, const std::string& to) {
    if (from == to)
        return;
    std::vector<std::pair<std::string, ModelNode>> moved;
    for (auto it = nodes_.begin(); it != nodes_.end();) {
        if (it->first == from || isUnder(it->first, from)) {
            moved.emplace_back(to + it->first.substr(from.size()), std::move(it->second));
            it = nodes_.erase(it);
        } else {
            ++it;
        }
    }
    for (auto& [path, node] : moved) nodes_[path] = std::move(node);
}

std::string ModelTree::rootOf(const std::string& path) const {
    for (const auto& root : roots_)
        if (path == root || isUnder(path, root))
            return root;
    return "";
}

bool ModelTree::isRoot(const std::string& path) const {
    for (const auto& root : roots_)
        if (path == root)
            return true;
    return false;
}

bool ModelTree::inTrash(const std::string& path) const {
    std::string root = rootOf(path);
    if (root.empty())
        return false;
    std::string trash = root + "/.Trash";
    return path == trash || isUnder(path, trash);
}

}  // namespace tamber::model
