#include "ScriptedHTTPServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>
#include <cerrno>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <optional>

namespace gwtest {

namespace {

constexpr int kPollMilliseconds = 50;

// Waits for `events` on the socket; false when the server is stopping.
bool waitFor(int socket, short events, const std::atomic<bool>& stopping) {
    while (!stopping) {
        pollfd entry{socket, events, 0};
        const int ready = ::poll(&entry, 1, kPollMilliseconds);
        if (ready > 0) {
            return true;
        }
        if (ready < 0 && errno != EINTR) {
            return false;
        }
    }
    return false;
}

bool sendAll(int socket, const std::uint8_t* bytes, std::size_t length,
             const std::atomic<bool>& stopping) {
    while (length > 0) {
        if (!waitFor(socket, POLLOUT, stopping)) {
            return false;
        }
        const ssize_t sent = ::send(socket, bytes, length, MSG_NOSIGNAL);
        if (sent <= 0) {
            return false;
        }
        bytes += sent;
        length -= std::size_t(sent);
    }
    return true;
}

bool sendText(int socket, const std::string& text, const std::atomic<bool>& stopping) {
    return sendAll(socket, reinterpret_cast<const std::uint8_t*>(text.data()), text.size(),
                   stopping);
}

// "Range: bytes=FIRST-LAST" or "bytes=FIRST-"; a missing LAST is the end.
std::optional<std::pair<std::uint64_t, std::uint64_t>> requestedRange(std::string head) {
    std::transform(head.begin(), head.end(), head.begin(),
                   [](unsigned char c) { return char(std::tolower(c)); });
    const auto at = head.find("\r\nrange: bytes=");
    if (at == std::string::npos) {
        return std::nullopt;
    }
    unsigned long long first = 0, last = UINT64_MAX;
    if (std::sscanf(head.c_str() + at + 15, "%llu-%llu", &first, &last) < 1) {
        return std::nullopt;
    }
    return std::make_pair(std::uint64_t(first), std::uint64_t(last));
}

}  // namespace

ScriptedHTTPServer::ScriptedHTTPServer(GWData content, Behaviour behaviour, std::uint64_t cutOffset)
    : content_(std::move(content)), behaviour_(behaviour), cutOffset_(cutOffset) {
    listener_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (listener_ < 0 ||
        ::bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listener_, 16) != 0 ||
        ::getsockname(listener_, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
        if (listener_ >= 0) {
            ::close(listener_);
        }
        listener_ = -1;
        return;
    }
    port_ = ntohs(address.sin_port);
    acceptor_ = std::thread([this] { acceptLoop(); });
}

ScriptedHTTPServer::~ScriptedHTTPServer() {
    stopping_ = true;
    if (acceptor_.joinable()) {
        acceptor_.join();
    }
    for (std::thread& connection : connections_) {
        connection.join();
    }
    if (listener_ >= 0) {
        ::close(listener_);
    }
}

std::string ScriptedHTTPServer::address(const std::string& name) const {
    return "http://127.0.0.1:" + std::to_string(port_) + "/" + name;
}

GWURL ScriptedHTTPServer::url(const std::string& name) const {
    return GWURL::URLWithString(address(name)).value_or(GWURL());
}

void ScriptedHTTPServer::acceptLoop() {
    while (waitFor(listener_, POLLIN, stopping_)) {
        const int connection = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
        if (connection < 0) {
            continue;
        }
        std::lock_guard lock(connectionsMutex_);
        connections_.emplace_back([this, connection] {
            serve(connection);
            ::close(connection);
        });
    }
}

void ScriptedHTTPServer::serve(int connection) {
    std::string buffer;
    char chunk[4096];
    while (!stopping_) {
        const auto end = buffer.find("\r\n\r\n");
        if (end != std::string::npos) {
            const std::string head = buffer.substr(0, end + 2);
            buffer.erase(0, end + 4);
            ++requests_;
            if (!respond(connection, head)) {
                return;
            }
            continue;
        }
        if (buffer.size() > 16384 || !waitFor(connection, POLLIN, stopping_)) {
            return;
        }
        const ssize_t received = ::recv(connection, chunk, sizeof chunk, 0);
        if (received <= 0) {
            return;
        }
        buffer.append(chunk, std::size_t(received));
    }
}

bool ScriptedHTTPServer::respond(int connection, const std::string& head) {
    const std::uint64_t size = content_.size();
    if (behaviour_ == Behaviour::notFound) {
        return sendText(connection, "HTTP/1.1 404 Not Found\r\nContent-Length: 9\r\n\r\nnot found",
                        stopping_);
    }
    const auto range = requestedRange(head);
    if (behaviour_ == Behaviour::ignoreRanges || !range) {
        return sendText(connection,
                        "HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(size) + "\r\n\r\n",
                        stopping_) &&
               sendAll(connection, content_.data(), content_.size(), stopping_);
    }
    if (range->first >= size) {
        return sendText(connection,
                        "HTTP/1.1 416 Range Not Satisfiable\r\nContent-Range: bytes */" +
                            std::to_string(size) + "\r\nContent-Length: 0\r\n\r\n",
                        stopping_);
    }
    std::uint64_t first = range->first;
    const std::uint64_t last = std::min(range->second, size - 1);
    if (behaviour_ == Behaviour::wrongRange && first < last) {
        ++first;
    }
    const std::string headers =
        "HTTP/1.1 206 Partial Content\r\nContent-Range: bytes " + std::to_string(first) + "-" +
        std::to_string(last) + "/" + std::to_string(size) +
        "\r\nContent-Length: " + std::to_string(last - first + 1) + "\r\n\r\n";
    const bool cut = (behaviour_ == Behaviour::dropAt || behaviour_ == Behaviour::stallAt) &&
                     cutOffset_ >= first && cutOffset_ <= last;
    const std::uint64_t stop = cut ? cutOffset_ : last + 1;
    if (!sendText(connection, headers, stopping_) ||
        !sendAll(connection, content_.data() + first, std::size_t(stop - first), stopping_)) {
        return false;
    }
    if (cut && behaviour_ == Behaviour::stallAt) {
        // Quiet until the client gives up and closes, or the server stops.
        char ignored[256];
        while (waitFor(connection, POLLIN, stopping_) &&
               ::recv(connection, ignored, sizeof ignored, 0) > 0) {
        }
    }
    return !cut;
}

}  // namespace gwtest
