#pragma once

// What the fuzz targets share: a silent log, a scratch folder that goes away at exit, and a
// reader that takes typed values off the front of the input.

#include <stdlib.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>
#include <system_error>

#include "support/Log.h"
#include "support/LogSink.h"

namespace tamber::fuzz {

// Thousands of inputs a second each log a line or two: written out they would cost more than
// the work, and say nothing a crash report does not.
class SilentSink : public LogSink {
public:
    void write(LogLevel, std::string_view) override {}
};

inline void silenceLog() {
    Log::shared().setDebugEnabled(false);
    Log::shared().setSink(std::make_shared<SilentSink>());
}

// Stops the run when a property does not hold, naming the line that checks it.
inline void check(bool holds, const char* file = __builtin_FILE(), int line = __builtin_LINE()) {
    if (holds)
        return;
    std::fprintf(stderr, "check failed at %s:%d\n", file, line);
    std::abort();
}

// A fresh folder in memory (/dev/shm, else /tmp), resolved (so that no link lies above what the
// target builds in it), removed when the process exits normally. In memory, the writers' syncs
// cost nothing: on a disk they would be most of every run.
inline const std::string& scratchFolder(const char* tag) {
    // On the heap and never freed: the exit handler that removes it runs after the statics
    // made later have gone.
    static const std::string* path = [tag] {
        std::error_code missing;
        const char* base = std::filesystem::is_directory("/dev/shm", missing) ? "/dev/shm" : "/tmp";
        std::string pattern = std::string(base) + "/tamber-fuzz-" + tag + "-XXXXXX";
        if (!::mkdtemp(pattern.data()))
            std::abort();
        auto* resolved = new std::string(std::filesystem::canonical(pattern).string());
        std::atexit([] {
            std::error_code ignored;
            std::filesystem::remove_all(scratchFolder(nullptr), ignored);
        });
        return resolved;
    }();
    return *path;
}

// Reads typed values off the front of the input; past its end every value is zero or empty.
class InputReader {
public:
    InputReader(const uint8_t* data, size_t size) : data_(data), size_(size) {}

    size_t remaining() const { return size_ - offset_; }
    uint8_t byte() { return offset_ < size_ ? data_[offset_++] : 0; }
    uint16_t u16() {
        uint16_t value = byte();
        return static_cast<uint16_t>(value | (byte() << 8));
    }
    uint64_t u64() {
        uint64_t value = 0;
        for (int i = 0; i < 8; ++i) value |= uint64_t(byte()) << (8 * i);
        return value;
    }
    // A length-prefixed (16-bit little-endian) piece, cut short at the end of the input.
    std::string piece() {
        size_t length = u16();
        return take(length);
    }
    std::string take(size_t length) {
        length = std::min(length, remaining());
        std::string text(reinterpret_cast<const char*>(data_ + offset_), length);
        offset_ += length;
        return text;
    }
    std::string rest() { return take(remaining()); }

private:
    const uint8_t* data_;
    size_t size_;
    size_t offset_ = 0;
};

// The writers' side of InputReader, for the seed writer.
inline std::string encodePiece(std::string_view text) {
    std::string out;
    out += char(text.size() & 0xff);
    out += char((text.size() >> 8) & 0xff);
    out += text;
    return out;
}

inline std::string encodeU64(uint64_t value) {
    std::string out;
    for (int i = 0; i < 8; ++i) out += char((value >> (8 * i)) & 0xff);
    return out;
}

}  // namespace tamber::fuzz
