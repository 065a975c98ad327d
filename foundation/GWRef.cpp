#include "GWRef.h"

namespace {

const char* const kURLKey = "URL";

bool canReference(const GWURL& url) {
    if (url.isFileURL()) {
        const std::string path = url.path();
        return !path.empty() && path[0] == '/';
    }
    return (url.scheme() == "http" || url.scheme() == "https") && !url.host().empty();
}

}  // namespace

GWRefPtr GWRef::initWithURL(const GWURL& url) {
    if (url.isEmpty() || !canReference(url)) {
        return nullptr;
    }
    return GWRefPtr(new GWRef(url));
}

GWRefPtr GWRef::copy() const {
    return GWRefPtr(new GWRef(url_));
}

void GWRef::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    coder.encodeValue(url_.absoluteString(), kURLKey);
}

GWRefPtr GWRef::initWithCoder(GWCoder& coder) {
    if (!coder.allowsKeyedCoding()) {
        return nullptr;
    }
    auto text = coder.decodeString(kURLKey);
    auto url = text ? GWURL::URLWithString(*text) : std::nullopt;
    return url ? initWithURL(*url) : nullptr;
}
