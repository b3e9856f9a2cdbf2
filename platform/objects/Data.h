#pragma once

#include <cstdint>
#include <vector>

#include "platform/objects/Object.h"

namespace tamber {

using Bytes = std::vector<uint8_t>;

class Data : public Object {
public:
    static constexpr std::string_view kClassName = "Data";
    explicit Data(Bytes bytes) : bytes_(std::move(bytes)) {}
    static std::shared_ptr<const Data> make(Bytes bytes);

    const Bytes& bytes() const { return bytes_; }

    std::string_view className() const override { return kClassName; }
    // "{length = N, bytes = 0x0011...}" with at most the first 24 bytes shown.
    std::string description() const override;
    bool isEqual(const Object& other) const override;

private:
    Bytes bytes_;
};

// The same text as Data::description, for raw bytes.
std::string describeBytes(const Bytes& bytes);

}  // namespace tamber
