#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>

#include "GWError.h"
#include "GWHTTPPrefetcher.h"
#include "GWURL.h"
#include "GWValue.h"

class GWFileHandleBackend;

// Position-based access to a file. Reads are positioned reads, so one handle
// never disturbs another open on the same file. Used by one operation at a time.
//
// http and https URLs are read with range requests over one kept-alive
// connection, with a small read-ahead cache; they cannot be written
// (NSCocoaErrorDomain 518). Opening asks for the first bytes, which fixes the
// file's identity: the URL after redirects, the size and a validator (strong
// entity tag, else Last-Modified). Remote failures are NSPOSIXErrorDomain errors:
//   ENOENT        404 or 410
//   EACCES        401, 403 or 407
//   ENOTSUP       the server ignores range requests (a 200 answer)
//   ESTALE        "the remote file changed while it was read": another size or
//                 validator, or a redirect where the first request had none
//   ECONNRESET    the connection ended before the whole range arrived
//   ETIMEDOUT     no connection, a too slow response or a missed deadline
//                 (GWHTTPTimeouts)
//   ECONNREFUSED  nobody listens (or the errno of the failed connect)
//   EHOSTUNREACH  the host name does not resolve
//   EPROTO        a TLS failure, or an answer for another range than asked
//   EPERM         a refused redirect: https to http, or into a loopback,
//                 link-local or private address from another kind of host
//   EPROTONOSUPPORT  a redirect to another scheme than http(s)
//   ELOOP         more than 5 redirects
//   EIO           any other status or transfer failure
// Bytes are handed on only once their whole range has arrived.
class GWRemoteFileHandle {
public:
    static std::shared_ptr<GWRemoteFileHandle> initForReadingFromURL(const GWURL& url,
                                                                     GWErrorPtr* error);
    // Creates (or empties) the file. With no URL the handle accepts and
    // discards whatever is written.
    static std::shared_ptr<GWRemoteFileHandle> initForWritingToURL(const std::optional<GWURL>& url,
                                                                   GWErrorPtr* error);
    // Writes from the start of the regular file open at `fd`, which the
    // caller keeps and closes; `url` names it in errors.
    static std::shared_ptr<GWRemoteFileHandle> initForWritingToDescriptor(int fd, const GWURL& url);

    explicit GWRemoteFileHandle(std::unique_ptr<GWFileHandleBackend> backend);
    ~GWRemoteFileHandle();
    GWRemoteFileHandle(const GWRemoteFileHandle&) = delete;
    GWRemoteFileHandle& operator=(const GWRemoteFileHandle&) = delete;

    // Up to `length` bytes from the current position, which advances. Fewer
    // at the end of the file, and empty data at the end.
    std::optional<GWData> readDataOfLength(std::uint64_t length, GWErrorPtr* error);
    // The same into the caller's buffer, at `offset`: up to into.size()
    // bytes, fewer only at the end of the file. A buffer read into again and
    // again is cleared and allocated once, not for every read.
    std::optional<std::size_t> readDataAtOffset(std::uint64_t offset, std::span<std::uint8_t> into,
                                                GWErrorPtr* error);
    bool seekToFileOffset(std::uint64_t offset, GWErrorPtr* error);
    std::uint64_t offsetInFile() const { return position_; }
    std::uint64_t fileSize() const;
    bool isSeekable() const;

    // (this handle, piece, is last piece, error) -> go on?
    using ReadHandler =
        std::function<bool(GWRemoteFileHandle& handle, std::span<const std::uint8_t> piece,
                           bool isLast, const GWErrorPtr& error)>;
    // Reads [offset, offset + length) in pieces of at most `maxBufferSize`
    // bytes (UINT64_MAX: the handle's own, large size). A file that ends
    // before the range does is an error, never a short final piece.
    void readDataAtOffset(std::uint64_t offset, std::uint64_t length, std::uint64_t maxBufferSize,
                          const ReadHandler& handler);

    // Announces ranges about to be read, in any order: a remote file
    // fetches them ahead, several at a time, adjacent ones together.
    void willRead(std::span<const GWByteRange> ranges);

    bool writeData(std::span<const std::uint8_t> bytes, GWErrorPtr* error);
    bool closeFileAndReturnError(GWErrorPtr* error);

    const std::optional<GWURL>& URL() const { return url_; }

    // The piece size used when the caller sets no limit.
    static constexpr std::size_t kDefaultPieceSize = 512 * 1024;

private:
    std::unique_ptr<GWFileHandleBackend> backend_;
    std::optional<GWURL> url_;
    std::uint64_t position_ = 0;
    bool closed_ = false;
};
