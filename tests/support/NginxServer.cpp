#include "NginxServer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

namespace gwtest {

namespace {

constexpr const char* kNginx = "/usr/sbin/nginx";

sockaddr_in loopback(int port) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(std::uint16_t(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return address;
}

std::string configuration(const std::string& folder, const std::string& root, int port,
                          const std::optional<NginxServer::TLSFiles>& tls,
                          const std::string& serverLines) {
    std::ostringstream text;
    text << "daemon off;\nmaster_process off;\nworker_processes 1;\n"
         << "pid " << folder << "/nginx.pid;\n"
         << "error_log " << folder << "/error.log warn;\n"
         << "events { worker_connections 256; }\n"
         << "http {\n"
         << "  log_format bytes '$connection $request_method $uri $status $body_bytes_sent "
            "\"$http_range\"';\n"
         << "  access_log " << folder << "/access.log bytes;\n";
    for (const char* temporary : {"client_body", "proxy", "fastcgi", "uwsgi", "scgi"}) {
        text << "  " << temporary << "_temp_path " << folder << "/" << temporary << ";\n";
    }
    text << "  default_type application/octet-stream;\n"
         << "  sendfile on;\n  keepalive_requests 100000;\n"
         << "  server {\n    listen 127.0.0.1:" << port << (tls ? " ssl" : "") << ";\n"
         << "    root " << root << ";\n";
    if (tls) {
        text << "    ssl_certificate " << tls->certificate << ";\n"
             << "    ssl_certificate_key " << tls->key << ";\n";
    }
    text << serverLines << "    location / { }\n  }\n}\n";
    return text.str();
}

}  // namespace

int freeLocalPort() {
    const int socket = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address = loopback(0);
    socklen_t length = sizeof address;
    int port = 0;
    if (socket >= 0 && ::bind(socket, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0 &&
        ::getsockname(socket, reinterpret_cast<sockaddr*>(&address), &length) == 0) {
        port = ntohs(address.sin_port);
    }
    if (socket >= 0) {
        ::close(socket);
    }
    return port;
}

bool localPortAccepts(int port) {
    const int socket = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (socket < 0) {
        return false;
    }
    sockaddr_in address = loopback(port);
    const bool accepted =
        ::connect(socket, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
    ::close(socket);
    return accepted;
}

bool NginxServer::available() {
    return ::access(kNginx, X_OK) == 0;
}

NginxServer::NginxServer(const std::string& documentRoot, std::optional<TLSFiles> tls,
                         const std::string& serverLines)
    : tls_(std::move(tls)), serverLines_(serverLines) {
    if (!available()) {
        failure_ = "nginx is not installed";
        return;
    }
    // Another process may take the free port before nginx binds it.
    for (int attempt = 0; attempt < 3 && !running(); ++attempt) {
        start(documentRoot, freeLocalPort());
    }
}

NginxServer::~NginxServer() {
    stop();
}

bool NginxServer::start(const std::string& documentRoot, int port) {
    const std::string folder = directory_.path();
    {
        std::ofstream conf(folder + "/nginx.conf", std::ios::trunc);
        conf << configuration(folder, documentRoot, port, tls_, serverLines_);
    }
    const std::string errorLog = folder + "/error.log", conf = folder + "/nginx.conf";
    const std::string output = folder + "/output.log";
    const pid_t parent = ::getpid();
    const pid_t pid = ::fork();
    if (pid < 0) {
        failure_ = "fork failed";
        return false;
    }
    if (pid == 0) {
        // Only async-signal-safe calls until exec. The server dies with the test.
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (::getppid() != parent) {
            ::_exit(127);
        }
        const int log = ::open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        if (log >= 0) {
            ::dup2(log, 1);
            ::dup2(log, 2);
        }
        ::execl(kNginx, "nginx", "-e", errorLog.c_str(), "-p", folder.c_str(), "-c", conf.c_str(),
                static_cast<char*>(nullptr));
        ::_exit(127);
    }
    for (int poll = 0; poll < 250; ++poll) {
        int status = 0;
        if (::waitpid(pid, &status, WNOHANG) == pid) {
            std::ifstream error(errorLog);
            failure_ = "nginx exited: " + std::string(std::istreambuf_iterator<char>(error), {});
            return false;
        }
        if (localPortAccepts(port)) {
            pid_ = pid;
            port_ = port;
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    ::kill(pid, SIGKILL);
    ::waitpid(pid, nullptr, 0);
    failure_ = "nginx did not start listening";
    return false;
}

void NginxServer::stop() {
    if (pid_ <= 0) {
        return;
    }
    ::kill(pid_, SIGTERM);
    for (int poll = 0; poll < 100; ++poll) {
        if (::waitpid(pid_, nullptr, WNOHANG) == pid_) {
            pid_ = -1;
            return;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
}

std::string NginxServer::address(const std::string& name) const {
    return std::string(tls_ ? "https" : "http") + "://127.0.0.1:" + std::to_string(port_) + "/" +
           name;
}

GWURL NginxServer::url(const std::string& name) const {
    return GWURL::URLWithString(address(name)).value_or(GWURL());
}

std::vector<NginxServer::Request> NginxServer::requests() const {
    // nginx logs a request just after sending its last byte, which the client
    // may already have read: wait until the log stops growing.
    const std::string path = directory_.path() + "/access.log";
    std::string text, previous;
    for (int poll = 0; poll < 20; ++poll) {
        std::ifstream log(path);
        text.assign(std::istreambuf_iterator<char>(log), {});
        if (poll > 0 && text == previous) {
            break;
        }
        previous = text;
        std::this_thread::sleep_for(std::chrono::milliseconds(30));
    }
    std::vector<Request> requests;
    std::istringstream lines(text);
    std::string line;
    while (std::getline(lines, line)) {
        std::istringstream fields(line);
        Request request;
        fields >> request.connection >> request.method >> request.uri >> request.status >>
            request.bodyBytes;
        std::getline(fields >> std::ws, request.range);
        if (request.range.size() >= 2 && request.range.front() == '"') {
            request.range = request.range.substr(1, request.range.size() - 2);
        }
        requests.push_back(std::move(request));
    }
    return requests;
}

std::uint64_t NginxServer::bodyBytesSent() const {
    std::uint64_t total = 0;
    for (const Request& request : requests()) {
        total += request.bodyBytes;
    }
    return total;
}

void NginxServer::forgetRequests() {
    requests();  // lets the log settle first
    std::ofstream(directory_.path() + "/access.log", std::ios::trunc);
}

}  // namespace gwtest
