#include "GWHTTPRangeReader.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/ssl.h>
#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <mutex>
#include <optional>
#include <string_view>
#include <thread>

#include "GWFormat.h"

namespace {

std::mutex gTimeoutsMutex;
GWHTTPTimeouts gTimeouts;

bool startsWithIgnoringCase(std::string_view text, std::string_view prefix) {
    return text.size() >= prefix.size() &&
           std::equal(prefix.begin(), prefix.end(), text.begin(), [](char a, char b) {
               return std::tolower((unsigned char)a) == std::tolower((unsigned char)b);
           });
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) {
        text.remove_prefix(1);
    }
    while (!text.empty() && (text.back() == '\r' || text.back() == '\n' || text.back() == ' ')) {
        text.remove_suffix(1);
    }
    return text;
}

// A whole decimal number, nothing before or after it.
std::optional<std::uint64_t> number(std::string_view text) {
    std::uint64_t value = 0;
    auto [end, problem] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (problem != std::errc() || end != text.data() + text.size() || text.empty()) {
        return std::nullopt;
    }
    return value;
}

// "bytes FIRST-LAST/TOTAL", "bytes */TOTAL" or "bytes FIRST-LAST/*".
struct ContentRange {
    std::optional<std::uint64_t> first, last, total;
};

std::optional<ContentRange> parseContentRange(std::string_view value) {
    value = trimmed(value);
    if (!startsWithIgnoringCase(value, "bytes ")) {
        return std::nullopt;
    }
    value = trimmed(value.substr(6));
    const auto slash = value.find('/');
    if (slash == std::string_view::npos) {
        return std::nullopt;
    }
    ContentRange range;
    const std::string_view span = value.substr(0, slash), total = value.substr(slash + 1);
    if (total != "*" && !(range.total = number(total))) {
        return std::nullopt;
    }
    if (span != "*") {
        const auto dash = span.find('-');
        if (dash == std::string_view::npos) {
            return std::nullopt;
        }
        range.first = number(span.substr(0, dash));
        range.last = number(span.substr(dash + 1));
        if (!range.first || !range.last || *range.last < *range.first) {
            return std::nullopt;
        }
    }
    return range;
}

// Servers are trusted as signing certificates are: through OpenSSL's default
// locations (which SSL_CERT_FILE and SSL_CERT_DIR may move), besides curl's
// own bundle.
CURLcode addDefaultTrust(CURL*, void* context, void*) {
    SSL_CTX_set_default_verify_paths(static_cast<SSL_CTX*>(context));
    return CURLE_OK;
}

void initialiseCurlOnce() {
    static std::once_flag once;
    std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

int numberForCurlCode(CURLcode code, long osErrno) {
    switch (code) {
        case CURLE_OPERATION_TIMEDOUT: return ETIMEDOUT;
        case CURLE_COULDNT_CONNECT: return osErrno > 0 ? int(osErrno) : ECONNREFUSED;
        case CURLE_COULDNT_RESOLVE_HOST:
        case CURLE_COULDNT_RESOLVE_PROXY: return EHOSTUNREACH;
        case CURLE_PARTIAL_FILE:
        case CURLE_RECV_ERROR:
        case CURLE_SEND_ERROR:
        case CURLE_GOT_NOTHING: return ECONNRESET;
        case CURLE_UNSUPPORTED_PROTOCOL: return EPROTONOSUPPORT;
        case CURLE_OUT_OF_MEMORY: return ENOMEM;
        case CURLE_PEER_FAILED_VERIFICATION:
        case CURLE_SSL_CONNECT_ERROR:
        case CURLE_SSL_CERTPROBLEM:
        case CURLE_SSL_CIPHER:
        case CURLE_SSL_CACERT_BADFILE:
        case CURLE_SSL_ISSUER_ERROR:
        case CURLE_SSL_PINNEDPUBKEYNOTMATCH:
        case CURLE_SSL_INVALIDCERTSTATUS: return EPROTO;
        default: return EIO;
    }
}

int numberForStatus(long status) {
    switch (status) {
        case 404:
        case 410: return ENOENT;
        case 401:
        case 403:
        case 407: return EACCES;
        // A full answer to a ranged request: reading on would fetch the whole
        // resource for every read.
        case 200: return ENOTSUP;
        // Only a resource that shrank refuses a range inside its known size.
        case 416: return ESTALE;
        default: return EIO;
    }
}

// Where an address leads. A redirect may lead to a public address, or to one
// of the kind the first request reached: never from a public host into the
// loopback, a private network or a link-local service.
enum AddressClass { kPublicAddress, kPrivateAddress, kLoopbackAddress, kLinkLocalAddress };

int classOfIPv4(const std::uint8_t* bytes) {
    if (bytes[0] == 127 || bytes[0] == 0) {
        return kLoopbackAddress;
    }
    if (bytes[0] == 169 && bytes[1] == 254) {
        return kLinkLocalAddress;
    }
    if (bytes[0] == 10 || (bytes[0] == 172 && (bytes[1] & 0xF0) == 16) ||
        (bytes[0] == 192 && bytes[1] == 168) || (bytes[0] == 100 && (bytes[1] & 0xC0) == 64)) {
        return kPrivateAddress;
    }
    return kPublicAddress;
}

int classOfIPv6(const std::uint8_t* bytes) {
    static constexpr std::uint8_t kMapped[12] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF};
    if (std::equal(kMapped, kMapped + 12, bytes)) {
        return classOfIPv4(bytes + 12);
    }
    if (std::all_of(bytes, bytes + 15, [](std::uint8_t byte) { return byte == 0; }) &&
        bytes[15] <= 1) {
        return kLoopbackAddress;  // ::1, and :: which reaches this host too
    }
    if (bytes[0] == 0xFE && (bytes[1] & 0xC0) == 0x80) {
        return kLinkLocalAddress;
    }
    return (bytes[0] & 0xFE) == 0xFC ? kPrivateAddress : kPublicAddress;
}

int classOfSocketAddress(const sockaddr* address) {
    if (address->sa_family == AF_INET) {
        return classOfIPv4(reinterpret_cast<const std::uint8_t*>(
            &reinterpret_cast<const sockaddr_in*>(address)->sin_addr));
    }
    if (address->sa_family == AF_INET6) {
        return classOfIPv6(reinterpret_cast<const std::uint8_t*>(
            &reinterpret_cast<const sockaddr_in6*>(address)->sin6_addr));
    }
    return kPublicAddress;
}

// The class of a host written as an address; none for a name.
std::optional<int> classOfLiteralHost(std::string host) {
    if (host.size() > 2 && host.front() == '[' && host.back() == ']') {
        host = host.substr(1, host.size() - 2);
    }
    std::uint8_t bytes[16];
    if (inet_pton(AF_INET, host.c_str(), bytes) == 1) {
        return classOfIPv4(bytes);
    }
    if (inet_pton(AF_INET6, host.c_str(), bytes) == 1) {
        return classOfIPv6(bytes);
    }
    return std::nullopt;
}

const char* addressClassName(int kind) {
    switch (kind) {
        case kPrivateAddress: return "a private";
        case kLoopbackAddress: return "a loopback";
        case kLinkLocalAddress: return "a link-local";
        default: return "a public";
    }
}

bool redirectMayReach(int origin, int target) {
    return target == kPublicAddress || target == origin;
}

struct URLParts {
    struct Deleter {
        void operator()(CURLU* handle) const { curl_url_cleanup(handle); }
    };
    std::unique_ptr<CURLU, Deleter> handle{curl_url()};

    std::string get(CURLUPart part, unsigned flags = 0) const {
        char* text = nullptr;
        if (curl_url_get(handle.get(), part, &text, flags) != CURLUE_OK || !text) {
            return {};
        }
        std::string value = text;
        curl_free(text);
        return value;
    }
    bool set(CURLUPart part, const char* value, unsigned flags = 0) {
        return curl_url_set(handle.get(), part, value, flags) == CURLUE_OK;
    }
    std::string lowerHost() const {
        std::string host = get(CURLUPART_HOST);
        std::transform(host.begin(), host.end(), host.begin(),
                       [](unsigned char c) { return char(std::tolower(c)); });
        return host;
    }
};

bool sameServer(const URLParts& a, const URLParts& b) {
    return a.lowerHost() == b.lowerHost() &&
           a.get(CURLUPART_PORT, CURLU_DEFAULT_PORT) == b.get(CURLUPART_PORT, CURLU_DEFAULT_PORT);
}

}  // namespace

std::string GWRedactedURLString(std::string_view address) {
    const auto scheme = address.find("://");
    if (scheme == std::string_view::npos) {
        return std::string(address);
    }
    const std::size_t authority = scheme + 3;
    const std::size_t authorityEnd =
        std::min(address.find_first_of("/?#", authority), address.size());
    const auto at = address.substr(0, authorityEnd).rfind('@');
    if (at == std::string_view::npos || at < authority) {
        return std::string(address);
    }
    return std::string(address.substr(0, authority)) + "***" + std::string(address.substr(at));
}

void GWSetHTTPTimeouts(const GWHTTPTimeouts& timeouts) {
    std::lock_guard lock(gTimeoutsMutex);
    gTimeouts = timeouts;
    gTimeouts.connectSeconds = std::max(1L, timeouts.connectSeconds);
    gTimeouts.stallSeconds = std::max(1L, timeouts.stallSeconds);
    gTimeouts.deadlineSeconds = std::max(1L, timeouts.deadlineSeconds);
    gTimeouts.deadlineBytesPerSecond = std::max(1L, timeouts.deadlineBytesPerSecond);
    gTimeouts.retries = std::clamp(timeouts.retries, 0, 10);
}

GWHTTPTimeouts GWCurrentHTTPTimeouts() {
    std::lock_guard lock(gTimeoutsMutex);
    return gTimeouts;
}

bool GWParseHTTPTimeouts(std::string_view text, GWHTTPTimeouts& timeouts) {
    while (!text.empty()) {
        const auto comma = std::min(text.find(','), text.size());
        const std::string_view item = text.substr(0, comma);
        text.remove_prefix(std::min(comma + 1, text.size()));
        const auto equals = item.find('=');
        const auto value =
            equals == std::string_view::npos ? std::nullopt : number(item.substr(equals + 1));
        if (!value || *value > 86400000) {
            return false;
        }
        const std::string_view key = item.substr(0, equals);
        if (key == "connect") {
            timeouts.connectSeconds = long(*value);
        } else if (key == "stall") {
            timeouts.stallSeconds = long(*value);
        } else if (key == "deadline") {
            timeouts.deadlineSeconds = long(*value);
        } else if (key == "retry") {
            timeouts.retryMilliseconds = long(*value);
            timeouts.retryAfterLimitSeconds =
                std::min<long>(timeouts.retryAfterLimitSeconds, long(*value / 1000 + 1));
        } else if (key == "retries") {
            timeouts.retries = int(std::min<std::uint64_t>(*value, 10));
        } else {
            return false;
        }
    }
    return true;
}

// One request: the range asked for, and what the response said and brought.
// Everything about the response is cleared when a new one begins, so no
// value of an earlier answer (a redirect, a retried attempt) can stand in
// for this one's.
struct GWHTTPRangeReader::Transfer {
    std::uint64_t offset = 0;
    std::span<std::uint8_t> into;
    bool opening = false;  // learns the identity; the resource may be empty
    std::string ifRange;   // the validator later requests send
    bool sendNetrc = true;
    std::optional<int> requiredClass;  // for a redirect's connection

    long status = 0;
    bool headersDone = false;
    std::optional<ContentRange> contentRange;  // as this response's header block said
    std::string entityTag, lastModified, location;
    long retryAfter = -1;
    int connectedClass = -1;
    bool refusedAddress = false;
    bool bodyStarted = false;
    bool rangeChecked = false;
    std::uint64_t total = 0;  // valid only once rangeChecked
    std::size_t expected = 0;
    std::size_t received = 0;
    int refusal = 0;  // why the body was refused, as an error number
    std::string refusalReason;
    char curlMessage[CURL_ERROR_SIZE] = {};

    void beginResponse() {
        status = 0;
        headersDone = bodyStarted = rangeChecked = refusedAddress = false;
        contentRange.reset();
        entityTag.clear();
        lastModified.clear();
        location.clear();
        retryAfter = -1;
        total = 0;
        expected = received = 0;
        refusal = 0;
        refusalReason.clear();
        curlMessage[0] = 0;
    }

    static std::size_t header(char* text, std::size_t size, std::size_t count, void* context) {
        auto& transfer = *static_cast<Transfer*>(context);
        const std::string_view line(text, size * count);
        // Trailers after the body, and anything after the final header
        // block, never describe the range.
        if (transfer.bodyStarted) {
            return size * count;
        }
        if (line.starts_with("HTTP/")) {
            if (transfer.status == 0 || transfer.status < 200) {
                transfer.beginResponse();
                const auto space = line.find(' ');
                transfer.status = space == std::string_view::npos
                                      ? 0
                                      : long(number(line.substr(space + 1, 3)).value_or(0));
            }
        } else if (transfer.headersDone) {
        } else if (trimmed(line).empty()) {
            transfer.headersDone = transfer.status >= 200;
        } else if (startsWithIgnoringCase(line, "content-range:")) {
            transfer.contentRange = parseContentRange(line.substr(14));
        } else if (startsWithIgnoringCase(line, "etag:")) {
            transfer.entityTag = trimmed(line.substr(5));
        } else if (startsWithIgnoringCase(line, "last-modified:")) {
            transfer.lastModified = trimmed(line.substr(14));
        } else if (startsWithIgnoringCase(line, "location:")) {
            transfer.location = trimmed(line.substr(9));
        } else if (startsWithIgnoringCase(line, "retry-after:")) {
            // An HTTP date instead of seconds counts as "soon".
            transfer.retryAfter =
                long(std::min<std::uint64_t>(number(trimmed(line.substr(12))).value_or(0), 86400));
        }
        return size * count;
    }

    static std::size_t body(char* bytes, std::size_t size, std::size_t count, void* context) {
        auto& transfer = *static_cast<Transfer*>(context);
        const std::size_t length = size * count;
        if (!transfer.bodyStarted) {
            transfer.bodyStarted = true;
            if (transfer.status != 206) {
                return 0;  // the status tells the error; its body (a redirect's too) is not wanted
            }
            if (!transfer.checkRange()) {
                return 0;
            }
        }
        if (length > transfer.expected - transfer.received) {
            return transfer.refuse(EPROTO, "the server sent more bytes than the range holds");
        }
        std::memcpy(transfer.into.data() + transfer.received, bytes, length);
        transfer.received += length;
        return length;
    }

    static curl_socket_t openSocket(void* context, curlsocktype, curl_sockaddr* address) {
        auto& transfer = *static_cast<Transfer*>(context);
        transfer.connectedClass = classOfSocketAddress(&address->addr);
        if (transfer.requiredClass &&
            !redirectMayReach(*transfer.requiredClass, transfer.connectedClass)) {
            transfer.refusedAddress = true;
            return CURL_SOCKET_BAD;
        }
        return ::socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
    }

    bool checkRange() {
        const std::uint64_t lastAsked = offset + into.size() - 1;
        const auto& range = contentRange;
        if (!range || !range->first || !range->total || *range->first != offset ||
            *range->last > lastAsked || *range->last >= *range->total) {
            return refuse(EPROTO, "the server answered with another range than the one asked for");
        }
        total = *range->total;
        expected = std::size_t(*range->last - *range->first + 1);
        rangeChecked = true;
        return true;
    }

    std::size_t refuse(int number, const char* reason) {
        refusal = number;
        refusalReason = reason;
        return 0;
    }
};

// An empty resource has no range to give: servers answer a range request for
// it with 416 and "bytes */0", or with an empty 200.
bool GWHTTPRangeReader::isEmptyResourceAnswer(CURL* curl, CURLcode code, const Transfer& transfer) {
    if (transfer.status == 416) {
        return transfer.contentRange && transfer.contentRange->total == 0u;
    }
    curl_off_t length = -1;
    curl_easy_getinfo(curl, CURLINFO_CONTENT_LENGTH_DOWNLOAD_T, &length);
    return transfer.status == 200 && code == CURLE_OK && length == 0 && transfer.received == 0;
}

GWHTTPConnectionPool::Easy GWHTTPConnectionPool::take() {
    std::lock_guard lock(mutex_);
    if (idle_.empty()) {
        return Easy(curl_easy_init());
    }
    Easy easy = std::move(idle_.back());
    idle_.pop_back();
    return easy;
}

void GWHTTPConnectionPool::give(Easy easy) {
    // More idle connections than readers run at once would only hold sockets.
    constexpr std::size_t kMostIdle = 16;
    std::lock_guard lock(mutex_);
    if (easy && idle_.size() < kMostIdle) {
        idle_.push_back(std::move(easy));
    }
}

GWHTTPRangeReader::GWHTTPRangeReader(GWURL url, std::shared_ptr<GWHTTPConnectionPool> pool)
    : url_(std::move(url)),
      shownAddress_(GWRedactedURLString(url_.absoluteString())),
      pool_(std::move(pool)),
      curl_(pool_ ? pool_->take() : GWHTTPConnectionPool::Easy(curl_easy_init())) {
    identity_.address = url_.absoluteString();
}

GWHTTPRangeReader::~GWHTTPRangeReader() {
    if (pool_) {
        pool_->give(std::move(curl_));
    }
}

std::unique_ptr<GWHTTPRangeReader> GWHTTPRangeReader::open(
    const GWURL& url, std::size_t probeLength, GWData& probe,
    std::shared_ptr<GWHTTPConnectionPool> pool, GWErrorPtr* error) {
    auto reader = attach(url, {}, std::move(pool), error);
    if (!reader) {
        return nullptr;
    }
    probe.assign(std::max<std::size_t>(probeLength, 1), 0);
    Transfer transfer;
    transfer.into = probe;
    transfer.opening = true;
    if (!reader->perform(transfer, error)) {
        return nullptr;
    }
    probe.resize(transfer.received);
    return reader;
}

std::unique_ptr<GWHTTPRangeReader> GWHTTPRangeReader::attach(
    const GWURL& url, GWHTTPIdentity identity, std::shared_ptr<GWHTTPConnectionPool> pool,
    GWErrorPtr* error) {
    initialiseCurlOnce();
    std::unique_ptr<GWHTTPRangeReader> reader(new GWHTTPRangeReader(url, std::move(pool)));
    if (!reader->curl_) {
        GWFail(error, GWPOSIXError(ENOMEM, url));
        return nullptr;
    }
    if (!identity.address.empty()) {
        reader->identity_ = std::move(identity);
    }
    return reader;
}

bool GWHTTPRangeReader::isConnectionFailure(const GWErrorPtr& error) {
    return error && error->domain() == kGWPOSIXErrorDomain &&
           (error->code() == ETIMEDOUT || error->code() == ECONNREFUSED ||
            error->code() == EHOSTUNREACH || error->code() == ENETUNREACH);
}

bool GWHTTPRangeReader::fetch(std::uint64_t offset, std::span<std::uint8_t> into,
                              GWErrorPtr* error) {
    if (into.empty()) {
        return true;
    }
    Transfer transfer;
    transfer.offset = offset;
    transfer.into = into;
    return perform(transfer, error);
}

CURLcode GWHTTPRangeReader::performOnce(const std::string& address, Transfer& transfer) {
    CURL* curl = curl_.get();
    const GWHTTPTimeouts timeouts = GWCurrentHTTPTimeouts();
    const std::string range = std::to_string(transfer.offset) + "-" +
                              std::to_string(transfer.offset + transfer.into.size() - 1);
    struct HeaderList {
        curl_slist* list = nullptr;
        ~HeaderList() { curl_slist_free_all(list); }
    } headers;
    if (!transfer.ifRange.empty()) {
        headers.list = curl_slist_append(nullptr, ("If-Range: " + transfer.ifRange).c_str());
    }
    const long deadline =
        (timeouts.connectSeconds + timeouts.deadlineSeconds) * 1000 +
        long(transfer.into.size() * 1000 / std::size_t(timeouts.deadlineBytesPerSecond));
    transfer.beginResponse();
    curl_easy_setopt(curl, CURLOPT_URL, address.c_str());
    curl_easy_setopt(curl, CURLOPT_RANGE, range.c_str());
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers.list);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
    // Redirects are followed here, one checked hop at a time.
    curl_easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 0L);
    curl_easy_setopt(curl, CURLOPT_NETRC,
                     transfer.sendNetrc ? long(CURL_NETRC_OPTIONAL) : long(CURL_NETRC_IGNORED));
    curl_easy_setopt(curl, CURLOPT_USERAGENT, "GWArchiveSupport/1.0");
    curl_easy_setopt(curl, CURLOPT_SSL_CTX_FUNCTION, &addDefaultTrust);
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, timeouts.connectSeconds);
    curl_easy_setopt(curl, CURLOPT_LOW_SPEED_LIMIT, std::max(1L, timeouts.lowSpeedBytes));
    curl_easy_setopt(curl, CURLOPT_LOW_SPEED_TIME, timeouts.stallSeconds);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, deadline);
    curl_easy_setopt(curl, CURLOPT_OPENSOCKETFUNCTION, &Transfer::openSocket);
    curl_easy_setopt(curl, CURLOPT_OPENSOCKETDATA, &transfer);
    curl_easy_setopt(curl, CURLOPT_HEADERFUNCTION, &Transfer::header);
    curl_easy_setopt(curl, CURLOPT_HEADERDATA, &transfer);
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, &Transfer::body);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &transfer);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, transfer.curlMessage);
    const CURLcode code = curl_easy_perform(curl);
    curl_off_t sent = 0, firstByte = 0, total = 0;
    curl_easy_getinfo(curl, CURLINFO_PRETRANSFER_TIME_T, &sent);
    curl_easy_getinfo(curl, CURLINFO_STARTTRANSFER_TIME_T, &firstByte);
    curl_easy_getinfo(curl, CURLINFO_TOTAL_TIME_T, &total);
    timing_ = {double(firstByte - sent) / 1e6, double(total - sent) / 1e6, transfer.received};
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, nullptr);
    curl_easy_setopt(curl, CURLOPT_HTTPHEADER, nullptr);
    return code;
}

// The next request after a redirect from `from`, or a failure when the hop is refused.
bool GWHTTPRangeReader::nextHop(const std::string& from, Transfer& transfer, std::string& next,
                                GWErrorPtr* error) {
    URLParts origin, base, target;
    origin.set(CURLUPART_URL, identity_.address.c_str());
    base.set(CURLUPART_URL, from.c_str());
    target.handle.reset(curl_url_dup(base.handle.get()));
    if (transfer.location.empty() || !target.handle ||
        !target.set(CURLUPART_URL, transfer.location.c_str(), CURLU_NON_SUPPORT_SCHEME)) {
        return GWFail(error, failure(EPROTO, transfer,
                                     GWFormat("the server answered with status %ld and no usable "
                                              "location to go to",
                                              transfer.status)));
    }
    std::string scheme = target.get(CURLUPART_SCHEME);
    std::transform(scheme.begin(), scheme.end(), scheme.begin(),
                   [](unsigned char c) { return char(std::tolower(c)); });
    if (scheme != "http" && scheme != "https") {
        return GWFail(error, failure(EPROTONOSUPPORT, transfer,
                                     "refused a redirect to a " + scheme + ": location"));
    }
    if (scheme == "http" && base.get(CURLUPART_SCHEME) == "https") {
        return GWFail(error,
                      failure(EPERM, transfer, "refused a redirect from https down to http"));
    }
    // Credentials stay with the server they were given for.
    target.set(CURLUPART_USER, nullptr);
    target.set(CURLUPART_PASSWORD, nullptr);
    transfer.sendNetrc = sameServer(origin, target);
    if (transfer.sendNetrc) {
        const std::string user = origin.get(CURLUPART_USER),
                          password = origin.get(CURLUPART_PASSWORD);
        if (!user.empty()) {
            target.set(CURLUPART_USER, user.c_str());
        }
        if (!password.empty()) {
            target.set(CURLUPART_PASSWORD, password.c_str());
        }
    }
    transfer.requiredClass = originClass_ < 0 ? kPublicAddress : originClass_;
    if (auto literal = classOfLiteralHost(target.get(CURLUPART_HOST))) {
        if (!redirectMayReach(*transfer.requiredClass, *literal)) {
            return GWFail(error, failure(EPERM, transfer,
                                         GWFormat("refused a redirect to %s address",
                                                  addressClassName(*literal))));
        }
    }
    next = target.get(CURLUPART_URL);
    return !next.empty() || GWFail(error, failure(EPROTO, transfer, "unusable redirect"));
}

bool GWHTTPRangeReader::perform(Transfer& transfer, GWErrorPtr* error) {
    CURL* curl = curl_.get();
    const GWHTTPTimeouts timeouts = GWCurrentHTTPTimeouts();
    if (!transfer.opening && !identity_.validator.empty()) {
        transfer.ifRange = identity_.validator;
    }
    std::string address = identity_.address;
    CURLcode code = CURLE_OK;
    for (int attempt = 0, hops = 0;;) {
        code = performOnce(address, transfer);
        if (transfer.opening && hops == 0 && transfer.connectedClass >= 0) {
            originClass_ = transfer.connectedClass;
        }
        const bool answered =
            code == CURLE_OK || (code == CURLE_WRITE_ERROR && transfer.status != 0);
        if (answered && transfer.refusal == 0 && transfer.status >= 300 && transfer.status < 400 &&
            transfer.status != 304) {
            if (!transfer.opening) {
                // Every later request goes to where the first one ended: a
                // redirect now means the server's file is another one.
                return GWFail(error, failure(ESTALE, transfer,
                                             "the remote file changed while it was read (the "
                                             "server now redirects it elsewhere)"));
            }
            if (++hops > 5) {
                return GWFail(error, failure(ELOOP, transfer, "more than 5 redirects"));
            }
            std::string next;
            if (!nextHop(address, transfer, next, error)) {
                return false;
            }
            address = next;
            continue;
        }
        const bool reset = code == CURLE_RECV_ERROR || code == CURLE_SEND_ERROR ||
                           code == CURLE_GOT_NOTHING || code == CURLE_PARTIAL_FILE;
        const bool busy = answered && (transfer.status == 429 || transfer.status == 503);
        if ((!reset && !busy) || transfer.refusal != 0 || attempt >= timeouts.retries) {
            break;
        }
        long wait = timeouts.retryMilliseconds << attempt++;
        if (transfer.retryAfter >= 0) {
            wait = std::max(wait,
                            std::min(transfer.retryAfter, timeouts.retryAfterLimitSeconds) * 1000);
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(wait));
    }
    if (transfer.opening) {
        identity_.address = address;
    }

    if (transfer.refusal != 0) {
        return GWFail(error, failure(transfer.refusal, transfer, transfer.refusalReason));
    }
    const bool answered = code == CURLE_OK || (code == CURLE_WRITE_ERROR && transfer.status != 0);
    if (!answered) {
        if (transfer.refusedAddress) {
            return GWFail(error, failure(EPERM, transfer,
                                         GWFormat("refused a redirect to %s address",
                                                  addressClassName(transfer.connectedClass))));
        }
        long osErrno = 0;
        curl_easy_getinfo(curl, CURLINFO_OS_ERRNO, &osErrno);
        const std::string reason = GWRedactedURLString(
            transfer.curlMessage[0] ? transfer.curlMessage : curl_easy_strerror(code));
        return GWFail(error, failure(numberForCurlCode(code, osErrno), transfer, reason));
    }
    if (transfer.opening && isEmptyResourceAnswer(curl, code, transfer)) {
        identity_.size = 0;
        return true;
    }
    if (transfer.status != 206) {
        // With If-Range, a whole answer or a failed precondition means the
        // validator no longer holds.
        if (!transfer.opening &&
            ((transfer.status == 200 && !transfer.ifRange.empty()) || transfer.status == 412)) {
            return GWFail(error, failure(ESTALE, transfer,
                                         GWFormat("the remote file changed while it was read "
                                                  "(status %ld to a request for this version)",
                                                  transfer.status)));
        }
        return GWFail(
            error, failure(numberForStatus(transfer.status), transfer,
                           GWFormat("the server answered with status %ld%s", transfer.status,
                                    transfer.status == 200 ? " (it does not support range requests)"
                                                           : "")));
    }
    // A 206 without a body never reached the range check.
    if (!transfer.rangeChecked && !transfer.checkRange()) {
        return GWFail(error, failure(transfer.refusal, transfer, transfer.refusalReason));
    }
    const bool strongTag = !transfer.entityTag.empty() && !transfer.entityTag.starts_with("W/");
    if (transfer.opening) {
        identity_.size = transfer.total;
        identity_.validatorIsEntityTag = strongTag;
        identity_.validator = strongTag ? transfer.entityTag : transfer.lastModified;
    } else {
        const std::string& now =
            identity_.validatorIsEntityTag ? transfer.entityTag : transfer.lastModified;
        if (transfer.total != identity_.size || now != identity_.validator) {
            return GWFail(
                error,
                failure(ESTALE, transfer,
                        transfer.total != identity_.size
                            ? GWFormat("the remote file changed while it was read (its size "
                                       "went from %llu to %llu bytes)",
                                       (unsigned long long)identity_.size,
                                       (unsigned long long)transfer.total)
                            : GWFormat("the remote file changed while it was read (%s was "
                                       "\"%s\", is now \"%s\")",
                                       identity_.validatorIsEntityTag ? "its entity tag"
                                                                      : "its modification date",
                                       identity_.validator.c_str(), now.c_str())));
        }
    }
    if (transfer.received != transfer.expected) {
        return GWFail(error, failure(ECONNRESET, transfer,
                                     GWFormat("the response ended after %zu of %zu bytes",
                                              transfer.received, transfer.expected)));
    }
    return true;
}

GWErrorPtr GWHTTPRangeReader::failure(int number, const Transfer& transfer,
                                      const std::string& reason) const {
    if (transfer.opening) {
        return GWGenerateError(kGWPOSIXErrorDomain, number, url_, nullptr, {},
                               "Could not open %s: %s", shownAddress_.c_str(), reason.c_str());
    }
    return GWGenerateError(kGWPOSIXErrorDomain, number, url_, nullptr, {},
                           "Could not read bytes %llu-%llu of %s: %s",
                           (unsigned long long)transfer.offset,
                           (unsigned long long)(transfer.offset + transfer.into.size() - 1),
                           shownAddress_.c_str(), reason.c_str());
}
