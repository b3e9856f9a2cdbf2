#include "platform/strata/AttributeList.h"

#include "platform/FileSystem.h"
#include "platform/strata/StrataService.h"

namespace tamber {

int GetAttributeList(int fd, CommonAttributes& out) {
    struct statx st {};
    if (FileSystem::current().statx(fd, "", AT_EMPTY_PATH, STATX_TYPE | STATX_MODE | STATX_INO,
                                    &st) != 0) {
        return -1;
    }
    out.device = encodeDevice(st.stx_dev_major, st.stx_dev_minor);
    out.mode = st.stx_mode;
    out.fileId = st.stx_ino;
    auto service = StrataService::current();
    out.documentId = service ? service->documentIdForInode(out.device, out.fileId) : 0;
    return 0;
}

}  // namespace tamber
