#include "platform/archive/BinaryPlistValidator.h"

#include <algorithm>
#include <cstring>
#include <string>
#include <unordered_map>

#include "platform/archive/ArchiveError.h"

namespace tamber {

namespace {

constexpr size_t kHeaderSize = 8;
constexpr size_t kTrailerSize = 32;

// Object markers (high nibble) that libplist reads.
constexpr uint8_t kSimple = 0x00;
constexpr uint8_t kInteger = 0x10;
constexpr uint8_t kReal = 0x20;
constexpr uint8_t kDate = 0x30;
constexpr uint8_t kData = 0x40;
constexpr uint8_t kAsciiString = 0x50;
constexpr uint8_t kUtf16String = 0x60;
constexpr uint8_t kUid = 0x80;
constexpr uint8_t kArray = 0xA0;
constexpr uint8_t kDictionary = 0xD0;

uint64_t readBigEndian(const uint8_t* p, size_t n) {
    uint64_t v = 0;
    for (size_t i = 0; i < n; ++i) v = (v << 8) | p[i];
    return v;
}

// libplist reads a field of an odd width as eight bytes, past the end of the field; that stays
// inside the buffer because the 32-byte trailer follows every object and the offset table.
bool isSupportedWidth(uint64_t n) {
    return n >= 1 && n <= 8;
}

uint64_t saturatingAdd(uint64_t a, uint64_t b) {
    return a > UINT64_MAX - b ? UINT64_MAX : a + b;
}

struct Expansion {
    uint64_t nodes = 0;
    uint64_t payload = 0;
};

class GraphWalk {
public:
    GraphWalk(const uint8_t* data, uint64_t tableOffset, uint8_t offsetSize, uint8_t refSize,
              uint64_t count, const BinaryPlistValidator::Limits& limits)
        : data_(data),
          objectEnd_(tableOffset),
          offsetSize_(offsetSize),
          refSize_(refSize),
          count_(count),
          limits_(limits) {}

    bool visit(uint64_t index, size_t depth, Expansion& out);
    const std::string& failure() const { return failure_; }

private:
    struct Entry {
        bool inProgress = true;
        Expansion expansion;
    };

    bool fail(std::string reason) {
        failure_ = std::move(reason);
        return false;
    }
    uint64_t offsetOf(uint64_t index) const {
        return readBigEndian(data_ + objectEnd_ + index * offsetSize_, offsetSize_);
    }
    bool readCount(uint64_t index, uint8_t low, uint64_t& pos, uint64_t& count);
    bool visitChildren(uint64_t index, uint64_t pos, uint64_t refs, bool isDictionary, size_t depth,
                       Expansion& total);

    const uint8_t* data_;
    uint64_t objectEnd_;  // objects lie between the header and the offset table
    uint8_t offsetSize_;
    uint8_t refSize_;
    uint64_t count_;
    BinaryPlistValidator::Limits limits_;
    // Only objects reached so far, so that a huge declared count costs nothing.
    std::unordered_map<uint64_t, Entry> visited_;
    std::string failure_;
};

bool GraphWalk::readCount(uint64_t index, uint8_t low, uint64_t& pos, uint64_t& count) {
    if (low != 0x0F) {
        count = low;
        return true;
    }
    if (pos >= objectEnd_)
        return fail("object " + std::to_string(index) + " is cut off");
    uint8_t marker = data_[pos];
    if ((marker & 0xF0) != kInteger || (marker & 0x0F) > 3)
        return fail("object " + std::to_string(index) + " has a malformed length");
    uint64_t width = uint64_t{1} << (marker & 0x0F);
    ++pos;
    if (width > objectEnd_ - pos)
        return fail("object " + std::to_string(index) + " is cut off");
    count = readBigEndian(data_ + pos, width);
    pos += width;
    return true;
}

bool GraphWalk::visitChildren(uint64_t index, uint64_t pos, uint64_t refs, bool isDictionary,
                              size_t depth, Expansion& total) {
    uint64_t keys = isDictionary ? refs / 2 : 0;
    for (uint64_t k = 0; k < refs; ++k) {
        uint64_t ref = readBigEndian(data_ + pos + k * refSize_, refSize_);
        if (ref >= count_)
            return fail("object " + std::to_string(index) + " refers to object " +
                        std::to_string(ref) + " of " + std::to_string(count_));
        Expansion child;
        if (!visit(ref, depth + 1, child))
            return false;
        if (k < keys) {
            uint8_t type = data_[offsetOf(ref)] & 0xF0;
            if (type != kAsciiString && type != kUtf16String)
                return fail("dictionary " + std::to_string(index) +
                            " has a key that is not a string");
        }
        total.nodes = saturatingAdd(total.nodes, child.nodes);
        total.payload = saturatingAdd(total.payload, child.payload);
        if (total.nodes > limits_.maxNodes)
            return fail("expands to more than " + std::to_string(limits_.maxNodes) + " objects");
        if (total.payload > limits_.maxPayloadBytes)
            return fail("expands to more than " + std::to_string(limits_.maxPayloadBytes) +
                        " bytes of strings and data");
    }
    return true;
}

bool GraphWalk::visit(uint64_t index, size_t depth, Expansion& out) {
    if (depth > limits_.maxDepth)
        return fail("objects nested deeper than " + std::to_string(limits_.maxDepth) + " levels");
    auto [it, inserted] = visited_.try_emplace(index);
    if (!inserted) {
        if (it->second.inProgress)
            return fail("object " + std::to_string(index) + " contains itself");
        out = it->second.expansion;
        return true;
    }

    uint64_t offset = offsetOf(index);
    if (offset < kHeaderSize || offset >= objectEnd_)
        return fail("offset of object " + std::to_string(index) + " is out of range");
    uint8_t marker = data_[offset];
    uint8_t type = marker & 0xF0;
    uint8_t low = marker & 0x0F;
    uint64_t pos = offset + 1;
    auto fits = [&](uint64_t bytes) { return bytes <= objectEnd_ - pos; };
    auto cutOff = [&] { return fail("object " + std::to_string(index) + " is cut off"); };

    Expansion total{1, 0};
    switch (type) {
        case kSimple:
            // Only the booleans: libplist 2.2 has no null, and fill bytes are not objects.
            if (marker != 0x08 && marker != 0x09)
                return fail("object " + std::to_string(index) + " has an unsupported marker");
            break;
        case kInteger:
            if (low > 4)
                return fail("integer " + std::to_string(index) + " has a bad width");
            if (!fits(uint64_t{1} << low))
                return cutOff();
            break;
        case kReal:
        case kDate:
            if (low != 3 && !(type == kReal && low == 2))
                return fail("real " + std::to_string(index) + " has a bad width");
            if (!fits(uint64_t{1} << low))
                return cutOff();
            break;
        case kUid:
            if (!isSupportedWidth(low + 1u))
                return fail("UID " + std::to_string(index) + " has a bad width");
            if (!fits(low + 1u))
                return cutOff();
            break;
        case kData:
        case kAsciiString:
        case kUtf16String:
        case kArray:
        case kDictionary: {
            uint64_t count = 0;
            if (!readCount(index, low, pos, count))
                return false;
            uint64_t unit = type == kUtf16String  ? 2
                            : type == kArray      ? refSize_
                            : type == kDictionary ? 2u * refSize_
                                                  : 1;
            if (count > (objectEnd_ - pos) / unit)
                return fail("object " + std::to_string(index) + " claims " + std::to_string(count) +
                            " entries, more than the data holds");
            if (type == kArray || type == kDictionary) {
                uint64_t refs = type == kDictionary ? count * 2 : count;
                if (!visitChildren(index, pos, refs, type == kDictionary, depth, total))
                    return false;
            } else {
                // libplist takes the bytes as they are, but writes anything non-ASCII as UTF-16,
                // mangling what is not UTF-8 (into strings it then cannot read back).
                if (type == kAsciiString && std::any_of(data_ + pos, data_ + pos + count,
                                                        [](uint8_t c) { return c >= 0x80; }))
                    return fail("string " + std::to_string(index) + " is not ASCII");
                // UTF-16 becomes up to three bytes of UTF-8 per unit, plus a terminator.
                total.payload = (type == kUtf16String ? count * 3 : count) + 1;
            }
            break;
        }
        default:
            return fail("object " + std::to_string(index) + " has an unsupported marker");
    }
    // Re-find: visiting children may have rehashed the table.
    Entry& entry = visited_[index];
    entry.inProgress = false;
    entry.expansion = total;
    out = total;
    return true;
}

}  // namespace

BinaryPlistValidator::Limits BinaryPlistValidator::limitsForSize(size_t size) {
    Limits limits;
    uint64_t justified = 2 * static_cast<uint64_t>(size) + 1024;
    limits.maxNodes = std::min(limits.maxNodes, justified);
    return limits;
}

Status BinaryPlistValidator::validate(const uint8_t* data, size_t size, const Limits& limits) {
    auto invalid = [](std::string reason) {
        return archiveError(ArchiveErrorCode::InvalidData, std::move(reason));
    };
    if (!data || size < kHeaderSize + kTrailerSize)
        return invalid("too short for a binary property list");
    if (std::memcmp(data, "bplist00", kHeaderSize) != 0)
        return invalid("not a binary property list");

    const uint8_t* trailer = data + size - kTrailerSize;
    uint8_t offsetSize = trailer[6];
    uint8_t refSize = trailer[7];
    uint64_t count = readBigEndian(trailer + 8, 8);
    uint64_t root = readBigEndian(trailer + 16, 8);
    uint64_t tableOffset = readBigEndian(trailer + 24, 8);
    if (!isSupportedWidth(offsetSize) || !isSupportedWidth(refSize))
        return invalid("unsupported offset or reference width");
    if (count == 0 || root >= count)
        return invalid("root object out of range");
    if (tableOffset < kHeaderSize || tableOffset > size - kTrailerSize)
        return invalid("offset table out of range");
    if (count > (size - kTrailerSize - tableOffset) / offsetSize)
        return invalid("offset table is cut off");

    GraphWalk walk(data, tableOffset, offsetSize, refSize, count, limits);
    Expansion expansion;
    if (!walk.visit(root, 1, expansion))
        return invalid(walk.failure());
    return Status::OK();
}

}  // namespace tamber
