#include "server/LoopbackListener.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

namespace tamber {

namespace {

constexpr int kSliceMs = 100;  // how often a waiting connection looks at the stop flag

// Waits until `sock` has `events`; false after `seconds` or, when `stopping` is given, once it
// is set.
bool waitFor(socket_t sock, short events, int seconds, const std::atomic<bool>* stopping) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    for (;;) {
        if (stopping && stopping->load())
            return false;
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                        deadline - std::chrono::steady_clock::now())
                        .count();
        if (left <= 0)
            return false;
        pollfd fd{sock, events, 0};
        int ready = ::poll(&fd, 1, static_cast<int>(std::min<long long>(left, kSliceMs)));
        if (ready > 0)
            return true;
        if (ready < 0 && errno != EINTR)
            return false;
    }
}

void addressOf(const sockaddr_storage& address, std::string& ip, int& port) {
    char text[INET6_ADDRSTRLEN] = {};
    if (address.ss_family == AF_INET) {
        const auto& v4 = reinterpret_cast<const sockaddr_in&>(address);
        ::inet_ntop(AF_INET, &v4.sin_addr, text, sizeof text);
        port = ntohs(v4.sin_port);
    } else if (address.ss_family == AF_INET6) {
        const auto& v6 = reinterpret_cast<const sockaddr_in6&>(address);
        ::inet_ntop(AF_INET6, &v6.sin6_addr, text, sizeof text);
        port = ntohs(v6.sin6_port);
    }
    ip = text;
}

// A connection as the library reads and writes it, with a read buffer (the library reads
// request lines a byte at a time).
class ConnectionStream : public httplib::Stream {
public:
    explicit ConnectionStream(socket_t sock) : sock_(sock) {}

    bool is_readable() const override {
        return begin_ < end_ || waitFor(sock_, POLLIN, LoopbackListener::kIdleSeconds, nullptr);
    }
    bool is_writable() const override {
        return waitFor(sock_, POLLOUT, LoopbackListener::kWriteSeconds, nullptr);
    }
    ssize_t read(char* ptr, size_t size) override {
        if (begin_ == end_) {
            if (!waitFor(sock_, POLLIN, LoopbackListener::kIdleSeconds, nullptr))
                return -1;
            ssize_t got;
            do {
                got = ::recv(sock_, buffer_, sizeof buffer_, 0);
            } while (got < 0 && errno == EINTR);
            if (got <= 0)
                return got;
            begin_ = 0;
            end_ = static_cast<size_t>(got);
        }
        size_t n = std::min(size, end_ - begin_);
        std::memcpy(ptr, buffer_ + begin_, n);
        begin_ += n;
        return static_cast<ssize_t>(n);
    }
    ssize_t write(const char* ptr, size_t size) override {
        if (!is_writable())
            return -1;
        ssize_t sent;
        do {
            sent = ::send(sock_, ptr, size, MSG_NOSIGNAL);
        } while (sent < 0 && errno == EINTR);
        return sent;
    }
    void get_remote_ip_and_port(std::string& ip, int& port) const override {
        sockaddr_storage address{};
        socklen_t length = sizeof address;
        if (::getpeername(sock_, reinterpret_cast<sockaddr*>(&address), &length) == 0)
            addressOf(address, ip, port);
    }
    void get_local_ip_and_port(std::string& ip, int& port) const override {
        sockaddr_storage address{};
        socklen_t length = sizeof address;
        if (::getsockname(sock_, reinterpret_cast<sockaddr*>(&address), &length) == 0)
            addressOf(address, ip, port);
    }
    socket_t socket() const override { return sock_; }

    // Whether bytes of a next request are already buffered.
    bool buffered() const { return begin_ < end_; }

private:
    socket_t sock_;
    char buffer_[4096];
    size_t begin_ = 0;
    size_t end_ = 0;
};

}  // namespace

bool LoopbackListener::process_and_close_socket(socket_t sock) {
    // A response goes out in more than one write (head, then body): with Nagle's algorithm on,
    // the body waits for the client's delayed acknowledgement of the head, 40 ms on Linux.
    int noDelay = 1;
    ::setsockopt(sock, IPPROTO_TCP, TCP_NODELAY, &noDelay, sizeof noDelay);
    ConnectionStream stream(sock);
    for (;;) {
        // Idle between requests: leave on a stop or after the idle timeout.
        if (!stream.buffered() && !waitFor(sock, POLLIN, kIdleSeconds, stopping_.get()))
            break;
        bool closed = false;
        if (!process_request(stream, stopping_->load(), closed, nullptr) || closed)
            break;
        if (stopping_->load())
            break;
    }
    ::shutdown(sock, SHUT_RDWR);
    ::close(sock);
    return true;
}

}  // namespace tamber
