#include "GWHTTPRangeReader.h"

#include <openssl/ssl.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <mutex>
#include <optional>
#include <string_view>

#include "GWFormat.h"

namespace {

std::atomic<long> gConnectSeconds{GWHTTPTimeouts().connectSeconds};
std::atomic<long> gStallSeconds{GWHTTPTimeouts().stallSeconds};

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
        case CURLE_TOO_MANY_REDIRECTS: return ELOOP;
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

}  // namespace

void GWSetHTTPTimeouts(const GWHTTPTimeouts& timeouts) {
    gConnectSeconds = std::max(1L, timeouts.connectSeconds);
    gStallSeconds = std::max(1L, timeouts.stallSeconds);
}

GWHTTPTimeouts GWCurrentHTTPTimeouts() {
    return {gConnectSeconds.load(), gStallSeconds.load()};
}

// One request: the range asked for, and what the response said and brought.
struct GWHTTPRangeReader::Transfer {
    std::uint64_t offset = 0;
    std::span<std::uint8_t> into;
    bool opening = false;  // learns the size; the resource may be empty

    long status = 0;
    std::optional<ContentRange> range;
    std::string entityTag;
    bool bodyStarted = false;
    std::size_t expected = 0;
    std::size_t received = 0;
    int refusal = 0;  // why the body was refused, as an error number
    std::string refusalReason;
    char curlMessage[CURL_ERROR_SIZE] = {};

    static std::size_t header(char* text, std::size_t size, std::size_t count, void* context) {
        auto& transfer = *static_cast<Transfer*>(context);
        const std::string_view line(text, size * count);
        if (line.starts_with("HTTP/")) {
            // A new response (after a redirect, say) replaces what came before.
            transfer.range.reset();
            transfer.entityTag.clear();
            const auto space = line.find(' ');
            transfer.status = space == std::string_view::npos
                                  ? 0
                                  : long(number(line.substr(space + 1, 3)).value_or(0));
        } else if (startsWithIgnoringCase(line, "content-range:")) {
            transfer.range = parseContentRange(line.substr(14));
        } else if (startsWithIgnoringCase(line, "etag:")) {
            transfer.entityTag = trimmed(line.substr(5));
        }
        return size * count;
    }

    static std::size_t body(char* bytes, std::size_t size, std::size_t count, void* context) {
        auto& transfer = *static_cast<Transfer*>(context);
        const std::size_t length = size * count;
        if (!transfer.bodyStarted) {
            transfer.bodyStarted = true;
            if (transfer.status != 206) {
                return 0;  // the status tells the error; its body is not wanted
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

    bool checkRange() {
        const std::uint64_t lastAsked = offset + into.size() - 1;
        if (!range || !range->first || !range->total || *range->first != offset ||
            *range->last > lastAsked || *range->last >= *range->total) {
            return refuse(EPROTO, "the server answered with another range than the one asked for");
        }
        expected = std::size_t(*range->last - *range->first + 1);
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
        return transfer.range && transfer.range->total == 0u;
    }
    curl_off_t length = -1;
    curl_easy_getinfo(curl, CURLINFO_CONTENT_LENGTH_DOWNLOAD_T, &length);
    return transfer.status == 200 && code == CURLE_OK && length == 0 && transfer.received == 0;
}

GWHTTPRangeReader::GWHTTPRangeReader(GWURL url)
    : url_(std::move(url)), address_(url_.absoluteString()), curl_(curl_easy_init()) {}

GWHTTPRangeReader::~GWHTTPRangeReader() = default;

std::unique_ptr<GWHTTPRangeReader> GWHTTPRangeReader::open(const GWURL& url,
                                                           std::size_t probeLength, GWData& probe,
                                                           GWErrorPtr* error) {
    auto reader = attach(url, 0, {}, error);
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
    reader->size_ = transfer.range && transfer.range->total ? *transfer.range->total : 0;
    reader->entityTag_ = transfer.entityTag;
    return reader;
}

std::unique_ptr<GWHTTPRangeReader> GWHTTPRangeReader::attach(const GWURL& url, std::uint64_t size,
                                                             std::string entityTag,
                                                             GWErrorPtr* error) {
    initialiseCurlOnce();
    std::unique_ptr<GWHTTPRangeReader> reader(new GWHTTPRangeReader(url));
    if (!reader->curl_) {
        GWFail(error, GWPOSIXError(ENOMEM, url));
        return nullptr;
    }
    reader->size_ = size;
    reader->entityTag_ = std::move(entityTag);
    return reader;
}

bool GWHTTPRangeReader::fetch(std::uint64_t offset, std::span<std::uint8_t> into,
                              GWErrorPtr* error) {
    if (into.empty()) {
        return true;
    }
    Transfer transfer;
    transfer.offset = offset;
    transfer.into = into;
    if (!perform(transfer, error)) {
        return false;
    }
    if (*transfer.range->total != size_) {
        return GWFail(error, failure(ESTALE, transfer,
                                     GWFormat("the resource changed size from %llu to %llu bytes",
                                              (unsigned long long)size_,
                                              (unsigned long long)*transfer.range->total)));
    }
    if (!entityTag_.empty() && !transfer.entityTag.empty() && transfer.entityTag != entityTag_) {
        return GWFail(error, failure(ESTALE, transfer,
                                     "the resource changed: its entity tag is now " +
                                         transfer.entityTag + ", was " + entityTag_));
    }
    if (transfer.received != into.size()) {
        return GWFail(error, failure(ECONNRESET, transfer, "the response ended early"));
    }
    return true;
}

bool GWHTTPRangeReader::perform(Transfer& transfer, GWErrorPtr* error) {
    CURL* curl = curl_.get();
    const GWHTTPTimeouts timeouts = GWCurrentHTTPTimeouts();
    const std::string range = std::to_string(transfer.offset) + "-" +
                              std::to_string(transfer.offset + transfer.into.size() - 1);
    curl_easy_setopt(curl, CURLOPT_URL, address_.c_str());
    curl_easy_setopt(curl, CURLOPT_RANGE, range.c_str());
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(curl, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 1L);
    curl_easy_setopt(curl, CURLOPT_MAXREDIRS, 5L);
    curl_easy_setopt(curl, CURLOPT_USERAGENT, "GWArchiveSupport/1.0");
    curl_easy_setopt(curl, CURLOPT_SSL_CTX_FUNCTION, &addDefaultTrust);
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, timeouts.connectSeconds);
    // A response that stops moving for the stall time is given up.
    curl_easy_setopt(curl, CURLOPT_LOW_SPEED_LIMIT, 1L);
    curl_easy_setopt(curl, CURLOPT_LOW_SPEED_TIME, timeouts.stallSeconds);
    curl_easy_setopt(curl, CURLOPT_HEADERFUNCTION, &Transfer::header);
    curl_easy_setopt(curl, CURLOPT_HEADERDATA, &transfer);
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, &Transfer::body);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &transfer);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, transfer.curlMessage);
    const CURLcode code = curl_easy_perform(curl);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, nullptr);

    if (transfer.refusal != 0) {
        return GWFail(error, failure(transfer.refusal, transfer, transfer.refusalReason));
    }
    const bool answered = code == CURLE_OK || (code == CURLE_WRITE_ERROR && transfer.status != 0);
    if (!answered) {
        long osErrno = 0;
        curl_easy_getinfo(curl, CURLINFO_OS_ERRNO, &osErrno);
        const std::string reason =
            transfer.curlMessage[0] ? transfer.curlMessage : curl_easy_strerror(code);
        return GWFail(error, failure(numberForCurlCode(code, osErrno), transfer, reason));
    }
    if (transfer.opening && isEmptyResourceAnswer(curl, code, transfer)) {
        transfer.range = ContentRange{std::nullopt, std::nullopt, 0};
        return true;
    }
    if (transfer.status != 206) {
        return GWFail(
            error, failure(numberForStatus(transfer.status), transfer,
                           GWFormat("the server answered with status %ld%s", transfer.status,
                                    transfer.status == 200 ? " (it does not support range requests)"
                                                           : "")));
    }
    // A 206 without a body never reached the range check.
    if (!transfer.bodyStarted && !transfer.checkRange()) {
        return GWFail(error, failure(transfer.refusal, transfer, transfer.refusalReason));
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
                               "Could not open %s: %s", address_.c_str(), reason.c_str());
    }
    return GWGenerateError(kGWPOSIXErrorDomain, number, url_, nullptr, {},
                           "Could not read bytes %llu-%llu of %s: %s",
                           (unsigned long long)transfer.offset,
                           (unsigned long long)(transfer.offset + transfer.into.size() - 1),
                           address_.c_str(), reason.c_str());
}
