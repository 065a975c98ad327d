#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "foundation/GWFoundation.h"

namespace gwtest {

// A tiny HTTP/1.1 server on 127.0.0.1 that serves one resource and misbehaves
// on purpose, for the failures nginx will not stage. Each connection gets a
// thread; everything stops when the object goes.
class ScriptedHTTPServer {
public:
    enum class Behaviour {
        honourRanges,    // 206 with the range asked for
        ignoreRanges,    // 200 with the whole resource
        notFound,        // 404
        wrongRange,      // 206 for a range that starts one byte late
        dropAt,          // honours ranges but closes the connection at `cutOffset`
        stallAt,         // honours ranges but goes quiet at `cutOffset`
        silent,          // reads requests and never answers
        trickle,         // honours ranges at one byte a second
        chunkedTrailer,  // chunked 206 bodies with a bogus Content-Range in the trailer
    };
    // How the served file identifies itself.
    enum class Validators { none, weakTagAndDate, strongTag, strongTagDroppedLater };

    // Everything beyond the behaviour; requests are counted from 1.
    struct Script {
        Behaviour behaviour = Behaviour::honourRanges;
        std::uint64_t cutOffset = 0;
        Validators validators = Validators::none;
        GWData replacement;  // served from request `replaceAt` on
        int replaceAt = 0;
        // Request `redirectAt` (0: every one) answers 302 to it; "{port}" is the server's.
        std::string location;
        int redirectAt = -1;
        int busyRequests = 0;  // the first ones answer 503 with Retry-After: 1
    };

    ScriptedHTTPServer(GWData content, Behaviour behaviour, std::uint64_t cutOffset = 0);
    ScriptedHTTPServer(GWData content, Script script);
    ~ScriptedHTTPServer();
    ScriptedHTTPServer(const ScriptedHTTPServer&) = delete;
    ScriptedHTTPServer& operator=(const ScriptedHTTPServer&) = delete;

    bool running() const { return listener_ >= 0; }
    GWURL url(const std::string& name = "archive") const;
    std::string address(const std::string& name = "archive") const;
    int requestCount() const { return requests_; }
    int requestsWithCredentials() const { return authorized_; }

private:
    void acceptLoop();
    void serve(int connection);
    bool respond(int connection, const std::string& head, int number);

    GWData content_;
    Script script_;
    Behaviour behaviour_;
    std::uint64_t cutOffset_;
    int listener_ = -1;
    int port_ = 0;
    std::atomic<bool> stopping_{false};
    std::atomic<int> requests_{0};
    std::atomic<int> authorized_{0};
    std::thread acceptor_;
    std::mutex connectionsMutex_;
    std::vector<std::thread> connections_;
};

}  // namespace gwtest
