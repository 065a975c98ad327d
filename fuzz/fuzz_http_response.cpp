// Range requests answered by a server that says anything at all: the reader
// ends in the bytes asked for or an error. Location lines are taken out of
// the answer, so no redirect is followed and nothing but this loopback
// server is ever asked.

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <mutex>
#include <string>
#include <thread>

#include "FuzzSupport.h"
#include "foundation/GWHTTPRangeReader.h"

namespace {

std::mutex gMutex;
std::string gAnswer;

// Answers every request on a connection of its own with the current input,
// then closes it, so a response that is cut short ends at once.
int startServer() {
    const int listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (listener < 0 || ::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) ||
        ::listen(listener, 64) ||
        ::getsockname(listener, reinterpret_cast<sockaddr*>(&address), &length)) {
        std::abort();
    }
    std::thread([listener] {
        for (;;) {
            const int connection = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
            if (connection < 0) {
                continue;
            }
            std::string request;
            char buffer[4096];
            while (request.find("\r\n\r\n") == std::string::npos && request.size() < 65536) {
                pollfd entry{connection, POLLIN, 0};
                if (::poll(&entry, 1, 1000) <= 0) {
                    break;
                }
                const ssize_t got = ::recv(connection, buffer, sizeof buffer, 0);
                if (got <= 0) {
                    break;
                }
                request.append(buffer, std::size_t(got));
            }
            std::string answer;
            {
                std::lock_guard lock(gMutex);
                answer = gAnswer;
            }
            for (std::size_t sent = 0; sent < answer.size();) {
                const ssize_t wrote =
                    ::send(connection, answer.data() + sent, answer.size() - sent, MSG_NOSIGNAL);
                if (wrote <= 0) {
                    break;
                }
                sent += std::size_t(wrote);
            }
            ::shutdown(connection, SHUT_RDWR);
            ::close(connection);
        }
    }).detach();
    return ntohs(address.sin_port);
}

std::string withoutLocations(const std::uint8_t* data, std::size_t size) {
    std::string answer;
    std::string_view text(reinterpret_cast<const char*>(data), size);
    while (!text.empty()) {
        const std::size_t end = std::min(text.find('\n'), text.size() - 1) + 1;
        const std::string_view line = text.substr(0, end);
        std::string start(line.substr(0, 9));
        std::transform(start.begin(), start.end(), start.begin(),
                       [](unsigned char c) { return char(std::tolower(c)); });
        if (start != "location:") {
            answer += line;
        }
        text.remove_prefix(end);
    }
    return answer;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const int port = [] {
        gwfuzz::silenceLog();
        GWHTTPTimeouts quick;
        quick.connectSeconds = quick.stallSeconds = quick.deadlineSeconds = 1;
        quick.retries = 0;
        GWSetHTTPTimeouts(quick);
        return startServer();
    }();
    {
        std::lock_guard lock(gMutex);
        gAnswer = withoutLocations(data, size);
    }
    const auto url = GWURL::URLWithString("http://127.0.0.1:" + std::to_string(port) + "/a");
    GWData probe;
    auto reader = GWHTTPRangeReader::open(*url, 64, probe, nullptr, nullptr);
    if (!reader) {
        return 0;
    }
    if (probe.size() > 64 || probe.size() > reader->size()) {
        std::abort();
    }
    if (reader->size() > 16) {
        GWData bytes(std::size_t(std::min<std::uint64_t>(reader->size() - 8, 1000)));
        (void)reader->fetch(8, bytes, nullptr);
    }
    return 0;
}
