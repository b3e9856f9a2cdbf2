#pragma once

#include <atomic>
#include <memory>

#include <httplib.h>

namespace tamber {

// One listening socket of the server. It serves each connection itself, so that a stop does
// not wait out idle connections: between two requests a connection waits at most kIdleSeconds
// for the next, and leaves as soon as `stopping` is set; a request already begun is finished.
class LoopbackListener : public httplib::Server {
public:
    static constexpr int kIdleSeconds = 60;
    static constexpr int kWriteSeconds = 5;  // a client that takes no data this long is dropped

    explicit LoopbackListener(std::shared_ptr<std::atomic<bool>> stopping)
        : stopping_(std::move(stopping)) {}

private:
    bool process_and_close_socket(socket_t sock) override;

    std::shared_ptr<std::atomic<bool>> stopping_;
};

}  // namespace tamber
