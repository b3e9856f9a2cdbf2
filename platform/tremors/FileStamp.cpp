#include "platform/tremors/FileStamp.h"

#include <fcntl.h>

#include <utility>

#include "platform/FileSystem.h"
#include "platform/tremors/TremorFlags.h"

namespace tamber {

namespace {

int64_t nanoseconds(const struct statx_timestamp& t) {
    return t.tv_sec * 1'000'000'000 + t.tv_nsec;
}

}  // namespace

bool FileStamp::hasBirthTime(const struct statx& st) {
    return (st.stx_mask & STATX_BTIME) && (st.stx_btime.tv_sec != 0 || st.stx_btime.tv_nsec != 0);
}

bool FileStamp::read(const std::string& path, struct statx& st) {
    return FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, kMask, &st) == 0;
}

uint64_t FileStamp::birthOf(const struct statx& st) {
    if (hasBirthTime(st))
        return static_cast<uint64_t>(nanoseconds(st.stx_btime));
    // A directory's change time moves with every entry: it would make every folder that changed
    // while nothing watched read as replaced.
    if (S_ISDIR(st.stx_mode))
        return 0;
    return static_cast<uint64_t>(nanoseconds(st.stx_ctime));
}

InodeRecord FileStamp::recordOf(const struct statx& st, uint64_t parent, std::string name) {
    InodeRecord record{st.stx_ino, parent, std::move(name), kindOf(st.stx_mode), 0};
    record.birth = birthOf(st);
    record.size = st.stx_size;
    record.mtime = nanoseconds(st.stx_mtime);
    record.ctime = nanoseconds(st.stx_ctime);
    record.stamped = true;
    return record;
}

uint8_t FileStamp::kindOf(uint32_t mode) {
    if (S_ISREG(mode))
        return InodeRecord::kFile;
    if (S_ISDIR(mode))
        return InodeRecord::kDirectory;
    if (S_ISLNK(mode))
        return InodeRecord::kSymlink;
    return InodeRecord::kOther;
}

uint32_t FileStamp::kindFlag(uint8_t kind) {
    switch (kind) {
        case InodeRecord::kFile:
            return kTremorItemIsFile;
        case InodeRecord::kDirectory:
            return kTremorItemIsDir;
        case InodeRecord::kSymlink:
            return kTremorItemIsSymlink;
        default:
            return 0;
    }
}

bool FileStamp::isIndexedFile(const InodeRecord& indexed, const struct statx& st) {
    if (indexed.inode != st.stx_ino || indexed.kind != kindOf(st.stx_mode))
        return false;
    return !hasBirthTime(st) || !indexed.stamped || indexed.birth == 0 ||
           indexed.birth == birthOf(st);
}

bool FileStamp::sameFile(const InodeRecord& indexed, const InodeRecord& found) {
    return indexed.kind == found.kind && (!indexed.stamped || indexed.birth == 0 ||
                                          found.birth == 0 || indexed.birth == found.birth);
}

bool FileStamp::changedWhileAway(const InodeRecord& indexed, const InodeRecord& found) {
    return indexed.stamped && indexed.kind != InodeRecord::kDirectory &&
           (indexed.size != found.size || indexed.mtime != found.mtime);
}

bool FileStamp::differs(const InodeRecord& indexed, InodeRecord found) {
    found.docID = indexed.docID;  // kept apart from the entry
    return !(found == indexed);
}

}  // namespace tamber
