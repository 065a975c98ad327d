#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "support/TestSupport.h"

namespace gwtest {

// The system's nginx serving one folder on 127.0.0.1 (with range support, as
// nginx has for static files), configured in a private folder and stopped
// when the object goes. Every request is logged with the body bytes sent.
class NginxServer {
public:
    static bool available();

    // PEM files for serving https instead of http.
    struct TLSFiles {
        std::string certificate;
        std::string key;
    };

    // `serverLines` are more directives for the server, such as a redirect.
    explicit NginxServer(const std::string& documentRoot,
                         std::optional<TLSFiles> tls = std::nullopt,
                         const std::string& serverLines = "");
    ~NginxServer();
    NginxServer(const NginxServer&) = delete;
    NginxServer& operator=(const NginxServer&) = delete;

    bool running() const { return pid_ > 0; }
    // Why the server did not start.
    const std::string& failure() const { return failure_; }

    // The URL of a file below the document root.
    GWURL url(const std::string& name) const;
    std::string address(const std::string& name) const;

    struct Request {
        std::string method;
        std::string uri;
        std::string range;  // the Range header, "-" without one
        int status = 0;
        std::uint64_t bodyBytes = 0;
        std::uint64_t connection = 0;  // nginx's serial number of the connection
    };
    // The requests served since the last forgetRequests(), once the log is quiet.
    std::vector<Request> requests() const;
    std::uint64_t bodyBytesSent() const;
    void forgetRequests();

private:
    bool start(const std::string& documentRoot, int port);

    std::optional<TLSFiles> tls_;
    std::string serverLines_;
    void stop();

    TemporaryDirectory directory_;
    pid_t pid_ = -1;
    int port_ = 0;
    std::string failure_;
};

// A port on 127.0.0.1 that nobody listened on a moment ago.
int freeLocalPort();
// Whether something accepts connections on 127.0.0.1:port.
bool localPortAccepts(int port);

}  // namespace gwtest
