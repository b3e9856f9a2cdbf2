#include "platform/tremors/InotifyApi.h"

#include "platform/tremors/LinuxInotifyApi.h"

namespace tamber {

std::shared_ptr<InotifyApi> InotifyApi::system() {
    static const std::shared_ptr<InotifyApi> instance = std::make_shared<LinuxInotifyApi>();
    return instance;
}

}  // namespace tamber
