#include "host/HostPorterPage.h"

#include <string_view>

namespace tamber {

namespace {

Bytes bytesOf(std::string_view text) {
    return Bytes(text.begin(), text.end());
}

}  // namespace

const HostPorterPage& HostPorterInitialPageSortedByDate() {
    static const HostPorterPage page = bytesOf("HostPorterInitialPageSortedByDate");
    return page;
}

const HostPorterPage& HostPorterInitialPageSortedByName() {
    static const HostPorterPage page = bytesOf("HostPorterInitialPageSortedByName");
    return page;
}

bool isHostPorterInitialPage(const HostPorterPage& page) {
    return page == HostPorterInitialPageSortedByDate() ||
           page == HostPorterInitialPageSortedByName();
}

}  // namespace tamber
