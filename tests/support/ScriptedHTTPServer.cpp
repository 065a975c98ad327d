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
    : ScriptedHTTPServer(std::move(content), [&] {
          Script script;
          script.behaviour = behaviour;
          script.cutOffset = cutOffset;
          return script;
      }()) {}

ScriptedHTTPServer::ScriptedHTTPServer(GWData content, Script script)
    : content_(std::move(content)),
      script_(std::move(script)),
      behaviour_(script_.behaviour),
      cutOffset_(script_.cutOffset) {
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
            if (!respond(connection, head, ++requests_)) {
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

bool ScriptedHTTPServer::respond(int connection, const std::string& head, int number) {
    std::string lower = head;
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return char(std::tolower(c)); });
    authorized_ += lower.find("\r\nauthorization:") != std::string::npos;
    if (behaviour_ == Behaviour::silent) {
        return waitFor(connection, POLLIN, stopping_) && false;
    }
    if (behaviour_ == Behaviour::notFound) {
        return sendText(connection, "HTTP/1.1 404 Not Found\r\nContent-Length: 9\r\n\r\nnot found",
                        stopping_);
    }
    if (number <= script_.busyRequests) {
        return sendText(connection,
                        "HTTP/1.1 503 Busy\r\nRetry-After: 1\r\nContent-Length: 0\r\n\r\n",
                        stopping_);
    }
    if (script_.redirectAt == 0 || script_.redirectAt == number) {
        std::string location = script_.location;
        if (const auto at = location.find("{port}"); at != std::string::npos) {
            location.replace(at, 6, std::to_string(port_));
        }
        // With a body that never ends, which a client must not read.
        if (!sendText(connection,
                      "HTTP/1.1 302 Found\r\nLocation: " + location +
                          "\r\nContent-Length: 1000000000000\r\n\r\n",
                      stopping_)) {
            return false;
        }
        const GWData filler(4096, 'r');
        while (sendAll(connection, filler.data(), filler.size(), stopping_)) {
        }
        return false;
    }
    // The replacement is another file: a redirect elsewhere or a new version.
    const bool replaced = script_.replaceAt > 0 && number >= script_.replaceAt;
    const GWData& content =
        replaced || head.find(" /other ") != std::string::npos ? script_.replacement : content_;
    const std::uint64_t size = content.size();
    std::string validators;
    switch (script_.validators) {
        case Validators::none: break;
        case Validators::weakTagAndDate:
            validators =
                std::string("ETag: W/\"same\"\r\nLast-Modified: ") +
                (replaced ? "Sat, 03 Feb 2001 04:05:07 GMT" : "Sat, 03 Feb 2001 04:05:06 GMT") +
                "\r\n";
            break;
        case Validators::strongTag:
            validators = replaced ? "ETag: \"v2\"\r\n" : "ETag: \"v1\"\r\n";
            break;
        case Validators::strongTagDroppedLater:
            validators = replaced ? "" : "ETag: \"v1\"\r\n";
            break;
    }
    const auto range = requestedRange(head);
    if (behaviour_ == Behaviour::ignoreRanges || !range) {
        return sendText(connection,
                        "HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(size) + "\r\n\r\n",
                        stopping_) &&
               sendAll(connection, content.data(), content.size(), stopping_);
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
    const std::string rangeLine = "HTTP/1.1 206 Partial Content\r\n" + validators +
                                  "Content-Range: bytes " + std::to_string(first) + "-" +
                                  std::to_string(last) + "/" + std::to_string(size) + "\r\n";
    if (behaviour_ == Behaviour::chunkedTrailer) {
        char length[32];
        std::snprintf(length, sizeof length, "%llx\r\n", (unsigned long long)(last - first + 1));
        return sendText(connection,
                        rangeLine + "Transfer-Encoding: chunked\r\nTrailer: Content-Range\r\n\r\n" +
                            length,
                        stopping_) &&
               sendAll(connection, content.data() + first, std::size_t(last - first + 1),
                       stopping_) &&
               sendText(connection, "\r\n0\r\nContent-Range: bytes 99-9/x\r\n\r\n", stopping_);
    }
    const std::string headers =
        rangeLine + "Content-Length: " + std::to_string(last - first + 1) + "\r\n\r\n";
    if (behaviour_ == Behaviour::trickle) {
        if (!sendText(connection, headers, stopping_)) {
            return false;
        }
        for (std::uint64_t at = first; at <= last && !stopping_; ++at) {
            pollfd entry{connection, POLLIN, 0};
            if (!sendAll(connection, content.data() + at, 1, stopping_) ||
                ::poll(&entry, 1, 1000) != 0) {
                return false;  // the client gave up
            }
        }
        return true;
    }
    const bool cut = (behaviour_ == Behaviour::dropAt || behaviour_ == Behaviour::stallAt) &&
                     cutOffset_ >= first && cutOffset_ <= last;
    const std::uint64_t stop = cut ? cutOffset_ : last + 1;
    if (!sendText(connection, headers, stopping_) ||
        !sendAll(connection, content.data() + first, std::size_t(stop - first), stopping_)) {
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
