#include "GWACL.h"

#include <bit>
#include <cerrno>
#include <cstring>
#include <utility>
#include <vector>

#include <sys/acl.h>

#include "foundation/GWByteReader.h"

namespace {

constexpr std::string_view kMacHeader = "!#acl ";

bool isDigits(std::string_view text) {
    if (text.empty()) {
        return false;
    }
    for (char c : text) {
        if (c < '0' || c > '9') {
            return false;
        }
    }
    return true;
}

bool isWord(std::string_view text) {
    if (text.empty()) {
        return false;
    }
    for (char c : text) {
        if (!((c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_')) {
            return false;
        }
    }
    return true;
}

bool isUUID(std::string_view text) {
    if (text.size() != 36) {
        return false;
    }
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (c != '-') {
                return false;
            }
        } else if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F'))) {
            return false;
        }
    }
    return true;
}

std::vector<std::string_view> split(std::string_view text, char separator) {
    std::vector<std::string_view> parts;
    std::size_t start = 0;
    while (true) {
        const std::size_t end = text.find(separator, start);
        parts.push_back(text.substr(start, end == std::string_view::npos ? end : end - start));
        if (end == std::string_view::npos) {
            return parts;
        }
        start = end + 1;
    }
}

// "!#acl 1" optionally followed by flag words.
bool isMacHeaderLine(std::string_view line) {
    if (!line.starts_with(kMacHeader)) {
        return false;
    }
    auto words = split(line.substr(kMacHeader.size()), ' ');
    if (!isDigits(words[0])) {
        return false;
    }
    for (std::size_t i = 1; i < words.size(); ++i) {
        if (!isWord(words[i])) {
            return false;
        }
    }
    return true;
}

bool isMacEntryLine(std::string_view line) {
    auto fields = split(line, ':');
    if (fields.size() != 5 && fields.size() != 6) {
        return false;
    }
    if ((fields[0] != "user" && fields[0] != "group") || !isUUID(fields[1])) {
        return false;
    }
    std::string_view id = fields[3];
    if (id.starts_with('-')) {
        id.remove_prefix(1);
    }
    if (!id.empty() && !isDigits(id)) {
        return false;
    }
    if (fields[4] != "allow" && fields[4] != "deny") {
        return false;
    }
    if (fields.size() == 6 && !fields[5].empty()) {
        for (auto right : split(fields[5], ',')) {
            if (!isWord(right)) {
                return false;
            }
        }
    }
    return true;
}

// Tags that libacl renders and applies; anything else came from damaged bytes.
bool hasOnlyKnownTags(acl_t handle) {
    acl_entry_t entry;
    for (int which = ACL_FIRST_ENTRY; acl_get_entry(handle, which, &entry) == 1;
         which = ACL_NEXT_ENTRY) {
        acl_tag_t tag = ACL_UNDEFINED_TAG;
        if (acl_get_tag_type(entry, &tag) != 0) {
            return false;
        }
        switch (tag) {
            case ACL_USER_OBJ:
            case ACL_USER:
            case ACL_GROUP_OBJ:
            case ACL_GROUP:
            case ACL_MASK:
            case ACL_OTHER: break;
            default: return false;
        }
    }
    return true;
}

std::optional<GWACL> posixFailure(GWErrorPtr* error, int number) {
    GWFail(error, GWPOSIXError(number));
    return std::nullopt;
}

}  // namespace

std::optional<GWACL> GWACL::duplicate(acl_t handle) {
    if (!handle) {
        return std::nullopt;
    }
    acl_t copy = acl_dup(handle);
    if (!copy) {
        return std::nullopt;
    }
    return GWACL(copy);
}

std::optional<GWACL> GWACL::fromText(const std::string& text, GWErrorPtr* error) {
    // libacl would read only up to a NUL that decoded text may carry.
    if (text.find('\0') != std::string::npos) {
        return posixFailure(error, EINVAL);
    }
    errno = 0;
    if (acl_t handle = acl_from_text(text.c_str())) {
        return GWACL(handle);
    }
    const int number = errno ? errno : EINVAL;
    if (isMacExtendedText(text)) {
        return GWACL(text);
    }
    return posixFailure(error, number);
}

GWACL::GWACL(GWACL&& other) noexcept
    : handle_(std::exchange(other.handle_, nullptr)), macText_(std::move(other.macText_)) {}

GWACL& GWACL::operator=(GWACL&& other) noexcept {
    if (this != &other) {
        if (handle_) {
            acl_free(handle_);
        }
        handle_ = std::exchange(other.handle_, nullptr);
        macText_ = std::move(other.macText_);
    }
    return *this;
}

GWACL::~GWACL() {
    if (handle_) {
        acl_free(handle_);
    }
}

std::optional<GWACL> GWACL::copy() const {
    if (!handle_) {
        return GWACL(macText_);
    }
    return duplicate(handle_);
}

std::optional<std::string> GWACL::text() const {
    if (!handle_) {
        return macText_;
    }
    char* rendered = acl_to_text(handle_, nullptr);
    if (!rendered) {
        return std::nullopt;
    }
    std::string result(rendered);
    acl_free(rendered);
    return result;
}

std::optional<GWData> GWACL::externalData(GWErrorPtr* error) const {
    if (!handle_) {
        return GWData(macText_.begin(), macText_.end());
    }
    const ssize_t size = acl_size(handle_);
    if (size < 0) {
        GWFail(error, GWPOSIXError(errno));
        return std::nullopt;
    }
    GWData bytes(static_cast<std::size_t>(size));
    // libacl answers 0 rather than the byte count on success; acl_size is the length.
    if (acl_copy_ext(bytes.data(), handle_, size) < 0) {
        GWFail(error, GWPOSIXError(errno));
        return std::nullopt;
    }
    return bytes;
}

std::optional<GWACL> GWACL::fromExternalData(std::span<const std::uint8_t> bytes,
                                             GWErrorPtr* error) {
    const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    if (text.starts_with(kMacHeader.substr(0, 5))) {
        if (!isMacExtendedText(text)) {
            return posixFailure(error, EINVAL);
        }
        return GWACL(std::string(text));
    }
    // acl_copy_int trusts the size word at the front (host order, 64 bits
    // with padding), so it must name exactly the bytes we have.
    GWByteReader reader(bytes);
    const std::uint64_t low = reader.u32le();
    const std::uint64_t declared = low | std::uint64_t(reader.u32le()) << 32;
    if (!reader.ok() || std::endian::native != std::endian::little || declared != bytes.size()) {
        return posixFailure(error, EINVAL);
    }
    std::vector<std::uint64_t> aligned((bytes.size() + 7) / 8);
    std::memcpy(aligned.data(), bytes.data(), bytes.size());
    errno = 0;
    acl_t handle = acl_copy_int(aligned.data());
    if (!handle) {
        return posixFailure(error, errno ? errno : EINVAL);
    }
    GWACL acl(handle);
    if (!hasOnlyKnownTags(handle)) {
        return posixFailure(error, EINVAL);
    }
    return acl;
}

bool GWACL::isMacExtendedText(std::string_view text) {
    // One trailing line break is how the text form ends.
    if (text.ends_with('\n')) {
        text.remove_suffix(1);
    }
    auto lines = split(text, '\n');
    if (!isMacHeaderLine(lines[0])) {
        return false;
    }
    for (std::size_t i = 1; i < lines.size(); ++i) {
        if (!isMacEntryLine(lines[i])) {
            return false;
        }
    }
    return true;
}
