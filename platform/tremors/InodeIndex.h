#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

#include "platform/objects/Data.h"
#include "platform/tremors/InodeRecord.h"
#include "platform/tremors/SqliteDatabase.h"
#include "support/Result.h"

namespace tamber {

// The index of the watched trees, kept in the journal's database: for each inode its parent,
// name and kind, the document IDs (docID -> inode, at most one per inode) and a copy of each
// document's metadata attributes (name -> raw bytes), which follows the ID from inode to inode.
// The document-ID counter lives in the journal's meta row, next to the event counter.
//
// Not locked: TremorStore owns it and serialises every call.
class InodeIndex {
public:
    static constexpr size_t kMaxPathComponents = 4096;
    using Attributes = std::map<std::string, Bytes>;

    // Its tables, created with the rest of the journal's schema, and what brings the tables of
    // schema `version` to the next one (null when there is nothing to do).
    static const char* schema();
    static const char* upgradeFrom(int64_t version);

    explicit InodeIndex(SqliteDatabase& db) : db_(db) {}

    // Reads the document-ID counter and checks that no ID was handed out beyond it.
    Status load();

    // See TremorStore for the meaning of each call.
    Status upsert(const std::vector<InodeRecord>& records);
    Status remove(const std::vector<uint64_t>& inodes);
    Result<std::optional<InodeRecord>> find(uint64_t inode);
    // `rootPath` names the watched root whose top is that inode, or returns nullptr.
    Result<std::optional<std::string>> path(
        uint64_t inode, const std::function<const std::string*(uint64_t)>& rootPath);
    Result<std::vector<InodeRecord>> children(uint64_t parent);
    // Every entry below `top`, not below an inode of `stops` (nor those), each once.
    Result<std::vector<InodeRecord>> subtree(uint64_t top, std::unordered_set<uint64_t> stops);
    Result<std::vector<InodeRecord>> childrenNamed(uint64_t parent, std::string_view name);

    // Where an inode is and the document ID it has (0: none); nothing as the path when path()
    // would answer nothing.
    struct Placement {
        std::optional<std::string> path;
        uint32_t docID = 0;
    };
    // The placement of each of `inodes`, in order; the folders they share are walked once.
    Result<std::vector<Placement>> place(
        const std::vector<uint64_t>& inodes,
        const std::function<const std::string*(uint64_t)>& rootPath);

    // An inode to give a document ID, with the metadata copy a new ID starts with.
    struct NewDocument {
        uint64_t inode = 0;
        Attributes attributes;
    };
    // The document ID of each inode, in order: the one it has, else the next one with its
    // `attributes` kept. The new IDs are written in one transaction: when it fails, none is
    // handed out.
    Result<std::vector<uint32_t>> allocateDocumentIds(const std::vector<NewDocument>& documents);
    Result<uint32_t> allocateDocumentId(uint64_t inode);
    Result<std::optional<uint64_t>> inodeForDocumentId(uint32_t docID);
    Result<std::optional<uint32_t>> documentIdForInode(uint64_t inode);
    Status moveDocumentId(uint32_t docID, uint64_t newInode);
    Status detachDocumentId(uint32_t docID);
    Status clearDocumentId(uint32_t docID);

    Result<Attributes> documentAttributes(uint32_t docID);
    Status setDocumentAttribute(uint32_t docID, const std::string& name,
                                const std::optional<Bytes>& value);
    Status replaceDocumentAttributes(uint32_t docID, const Attributes& attributes);

private:
    static Result<std::vector<InodeRecord>> readAll(SqliteDatabase::Statement& stmt);
    // The first row of `sql` with `key` bound to its one parameter, read by `read`; nothing
    // when there is no such row.
    template <class T, class Read>
    Result<std::optional<T>> findOne(std::string_view sql, int64_t key, Read read);

    SqliteDatabase& db_;
    uint64_t nextDocumentId_ = 1;
};

}  // namespace tamber
