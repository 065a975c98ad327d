#include <gtest/gtest.h>

#include "support/CoderTestSupport.h"

#include "foundation/GWBinaryPropertyList.h"
#include "foundation/GWRef.h"

namespace {

GWURL urlFrom(const char* text) {
    auto url = GWURL::URLWithString(text);
    EXPECT_TRUE(url) << text;
    return url.value_or(GWURL());
}

// Stands in for a GWRef in an archive, with whatever "URL" value a damaged or
// foreign archive might hold.
class FakeRef : public GWCoding {
public:
    explicit FakeRef(std::optional<GWValue> url) : url_(std::move(url)) {}
    std::string className() const override { return "GWRef"; }
    void encodeWithCoder(GWCoder& coder) const override { coder.encodeValue(url_, "URL"); }

private:
    std::optional<GWValue> url_;
};

}  // namespace

TEST(GWRef, RefusesLocationsThatCannotBeReferenced) {
    EXPECT_FALSE(GWRef::initWithURL(GWURL()));
    for (const char* text :
         {"relative/archive.zip", "ftp://example.com/archive.zip", "mailto:someone@example.com",
          "http:/no-host/archive.zip", "https:archive.zip"}) {
        EXPECT_FALSE(GWRef::initWithURL(urlFrom(text))) << text;
    }
}

TEST(GWRef, AcceptsFileAndWebLocationsAndRoundTripsThemThroughAnArchive) {
    for (const GWURL& url :
         {GWURL::fileURLWithPath("/data/a b/\xC3\xA9t\xC3\xA9 100%.zip"),
          GWURL::fileURLWithPath("/tmp/dir", true), urlFrom("http://example.com/a.zip"),
          urlFrom("HTTPS://example.com/x/a%20b.zip?token=a%2Fb&v=2#part")}) {
        auto ref = GWRef::initWithURL(url);
        ASSERT_TRUE(ref) << url.absoluteString();
        auto copy = ref->copy();
        ASSERT_TRUE(copy && copy.get() != ref.get());
        EXPECT_EQ(copy->URL(), url);
        GWErrorPtr error;
        GWData archive = GWKeyedArchiver::archivedDataWithRootObject(ref, &error);
        auto back = GWKeyedUnarchiver::unarchiveObjectWithData<GWRef>(archive, &error);
        ASSERT_TRUE(back) << error->localizedDescription();
        EXPECT_EQ(back->URL(), url) << url.absoluteString();
    }
}

TEST(GWRef, AStoredURLThatIsMissingOrRefusedDecodesToNone) {
    GWCodingRegistry::registerClass<GWRef>();
    for (const auto& stored :
         {std::optional<GWValue>(), std::optional<GWValue>(GWValue("not a url")),
          std::optional<GWValue>(GWValue("ftp://example.com/a.zip")),
          std::optional<GWValue>(GWValue("relative/path")), std::optional<GWValue>(GWValue(42))}) {
        GWData archive = GWKeyedArchiver::archivedDataWithRootObject(FakeRef(stored));
        ASSERT_FALSE(archive.empty());
        GWErrorPtr error;
        EXPECT_FALSE(GWKeyedUnarchiver::unarchiveObjectWithData<GWRef>(archive, &error));
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    }
    // A non-keyed coder gets nothing and gives nothing.
    gwtest::RecordingCoder recorder;
    GWRef::initWithURL(GWURL::fileURLWithPath("/data/archive.zip"))->encodeWithCoder(recorder);
    EXPECT_EQ(recorder.writes, 0);
    GWNonKeyedCoder coder;
    EXPECT_FALSE(GWRef::initWithCoder(coder));
}
