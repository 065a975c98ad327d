#pragma once

#include <memory>
#include <string>

#include "GWCoder.h"
#include "GWExport.h"
#include "GWURL.h"

class GWRef;
using GWRefPtr = std::shared_ptr<GWRef>;

// An opaque token for an archive's location: made from a URL, gives the URL
// back, copied by value and persisted under the key "URL".
class GW_EXPORT GWRef final : public GWCoding {
public:
    static constexpr const char* kClassName = "GWRef";

    // None for a location that cannot be referenced: an empty or relative URL,
    // a scheme other than file, http and https, a file URL without an absolute
    // path, or a web URL without a host. Whether the file exists is left to
    // whoever opens it.
    static GWRefPtr initWithURL(const GWURL& url);

    const GWURL& URL() const { return url_; }
    GWRefPtr copy() const;

    std::string className() const override { return kClassName; }
    // Writes nothing to a non-keyed coder.
    void encodeWithCoder(GWCoder& coder) const override;
    // None from a non-keyed coder, or when the stored URL is missing or refused.
    static GWRefPtr initWithCoder(GWCoder& coder);

    friend bool operator==(const GWRef& a, const GWRef& b) { return a.url_ == b.url_; }

private:
    explicit GWRef(GWURL url) : url_(std::move(url)) {}

    GWURL url_;
};
