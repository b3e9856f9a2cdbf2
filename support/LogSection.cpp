#include "support/LogSection.h"

#include <limits>
#include <memory>
#include <string>

#include "support/DispatchQueue.h"
#include "support/Log.h"

namespace tamber {

namespace {

uint64_t nextNumber = 0;  // only touched on the section queue

DispatchQueue& sectionQueue() {
    // Never destroyed: sections may open while the process exits.
    static auto* queue =
        new std::shared_ptr<DispatchQueue>(DispatchQueue::makeSerial("tamber.log-section"));
    return **queue;
}

}  // namespace

uint64_t LogSection::takeNumber() {
    return sectionQueue().sync([] {
        if (nextNumber == std::numeric_limits<uint64_t>::max()) {
            fatalError("log section numbers are exhausted");
        }
        return nextNumber++;
    });
}

LogSection::LogSection(std::string_view title) : number_(takeNumber()) {
    logDebug([&] { return "┏" + std::to_string(number_) + " " + std::string(title); });
}

LogSection::~LogSection() {
    logDebug([&] { return "┗" + std::to_string(number_); });
}

}  // namespace tamber
