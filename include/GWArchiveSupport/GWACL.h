#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "GWError.h"
#include "GWExport.h"
#include "GWValue.h"

// libacl's handle, declared as <sys/acl.h> does, so that callers need no
// libacl headers to use the library.
struct __acl_ext;
typedef struct __acl_ext* acl_t;

// One access-control list as a XAR entry holds it. Usually a POSIX ACL owned
// through its libacl handle; archives made on Macs carry extended ACLs in the
// "!#acl 1" text form, which libacl cannot represent, so those are kept as
// their validated text instead and the archive still opens.
class GW_EXPORT GWACL {
public:
    // Takes over `handle`, which is freed with acl_free.
    static GWACL adopt(acl_t handle) { return GWACL(handle); }
    // A duplicate (acl_dup) of `handle`; the caller keeps its own. None for a
    // null handle or when duplicating fails.
    static std::optional<GWACL> duplicate(acl_t handle);
    // POSIX text through acl_from_text, else the Mac extended form. None with
    // the POSIX error of acl_from_text (errno) for text that is neither.
    static std::optional<GWACL> fromText(const std::string& text, GWErrorPtr* error);

    // Move-only: a copy is a fallible acl_dup, so it is asked for by name.
    GWACL(const GWACL&) = delete;
    GWACL& operator=(const GWACL&) = delete;
    GWACL(GWACL&& other) noexcept;
    GWACL& operator=(GWACL&& other) noexcept;
    ~GWACL();

    // None when acl_dup fails.
    std::optional<GWACL> copy() const;

    // The libacl handle, borrowed; null for a Mac extended ACL.
    acl_t handle() const { return handle_; }
    bool isMacExtended() const { return handle_ == nullptr; }
    // The text of a Mac extended ACL; empty for a POSIX one.
    const std::string& macExtendedText() const { return macText_; }

    // The POSIX text from acl_to_text, or the Mac text as held; none when
    // libacl cannot render the handle.
    std::optional<std::string> text() const;

    // A self-contained byte form that fromExternalData reads back: libacl's
    // external representation, or the Mac text. None with a POSIX error.
    std::optional<GWData> externalData(GWErrorPtr* error) const;
    // The bytes are untrusted: a libacl form is checked before libacl reads it.
    static std::optional<GWACL> fromExternalData(std::span<const std::uint8_t> bytes,
                                                 GWErrorPtr* error);

    // Whether `text` has the shape of a Mac extended ACL: a "!#acl <version>"
    // line, then entries "user|group:<uuid>:<name>:<id>:allow|deny[:<rights>]".
    static bool isMacExtendedText(std::string_view text);

private:
    explicit GWACL(acl_t handle) : handle_(handle) {}
    explicit GWACL(std::string macText) : macText_(std::move(macText)) {}

    acl_t handle_ = nullptr;
    std::string macText_;
};
