// Archives written by other tools list the same names, sizes, modes and
// times as zipinfo reports for them. Each test skips when its tool is missing.

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "zip/GWZipArchive.h"
#include "zip/ZipListingSupport.h"

namespace {

using namespace gwtest;

class GWZipArchivePeers : public ::testing::Test {
protected:
    void SetUp() override {
        if (!toolAvailable("zipinfo")) {
            GTEST_SKIP() << "zipinfo is not installed";
        }
        // Whole minutes: a DOS time keeps half the seconds, and this loader
        // (unlike zipinfo) does not double them back.
        const std::string tree = directory.file("tree");
        const std::string script =
            "set -e; mkdir -p " + shellQuote(tree) + "/dir/sub " + shellQuote(tree) +
            "/empty; cd " + shellQuote(tree) +
            "; printf 'hello\\n' > dir/a.txt; head -c 20000 /dev/urandom > dir/sub/random.bin;"
            " seq 1 3000 > 'dir/with space.txt'; printf '' > zero; chmod 600 zero;"
            " chmod 755 dir/sub; ln -s a.txt dir/link;"
            " touch -h -d '2021-03-04 05:06:00' dir/a.txt dir/sub/random.bin 'dir/with space.txt'"
            " zero dir/link dir/sub dir empty";
        ASSERT_EQ(runCommand(script).status, 0);
    }

    // Lists the archive both ways and compares. Entries zipinfo does not
    // list must be directories the loader made for paths without an entry.
    void expectSameListing(const std::string& archiveName, std::size_t minimumEntries = 1) {
        const std::string path = directory.file(archiveName);
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(GWURL::fileURLWithPath(path), &error);
        ASSERT_TRUE(archive) << (error ? error->localizedDescription() : "no error");
        const Listing theirs = zipinfoListing(path);
        ASSERT_GE(theirs.size(), minimumEntries);
        const Listing ours = listingOfTree(archive->files());
        for (const auto& [name, entry] : theirs) {
            auto found = ours.find(name);
            if (found == ours.end()) {
                ADD_FAILURE() << name << " is missing";
                continue;
            }
            EXPECT_EQ(found->second, entry) << name;
        }
        for (const auto& [name, entry] : ours) {
            if (!theirs.count(name)) {
                EXPECT_EQ(entry.mode[0], 'd') << name << " is not in zipinfo's listing";
            }
        }
    }

    void run(const std::string& command) {
        auto result =
            runCommand("cd " + shellQuote(directory.file("tree")) + " && " + command + " 2>&1");
        ASSERT_EQ(result.status, 0) << command << "\n" << result.output;
    }

    std::string out(const std::string& name) const { return shellQuote(directory.file(name)); }

    TemporaryDirectory directory;
};

TEST_F(GWZipArchivePeers, InfoZipWithAndWithoutExtraFieldsAndWithLinks) {
    if (!toolAvailable("zip")) {
        GTEST_SKIP() << "zip is not installed";
    }
    run("zip -qr " + out("plain.zip") + " dir empty zero");
    expectSameListing("plain.zip", 8);
    run("zip -qrX " + out("bare.zip") + " dir empty zero");
    expectSameListing("bare.zip", 8);
    run("zip -qry " + out("links.zip") + " dir empty zero");
    expectSameListing("links.zip", 8);
    auto archive = GWZipArchive::initWithURL(directory.url("links.zip"), nullptr);
    ASSERT_TRUE(archive);
    auto link = archive->fileWithPath("dir/link");
    ASSERT_TRUE(link);
    EXPECT_TRUE(link->isSymbolicLink());
}

TEST_F(GWZipArchivePeers, PythonZipfileStoredDeflatedBzip2AndZip64) {
    if (!toolAvailable("python3")) {
        GTEST_SKIP() << "python3 is not installed";
    }
    const std::string script = R"PY(
import os, sys, zipfile
out = sys.argv[1]
def tree(z):
    for root, dirs, files in os.walk('.'):
        for name in sorted(dirs) + sorted(files):
            path = os.path.relpath(os.path.join(root, name))
            if not os.path.islink(path):
                z.write(path)
for label, method in (('stored', zipfile.ZIP_STORED), ('deflated', zipfile.ZIP_DEFLATED),
                      ('bzip2', zipfile.ZIP_BZIP2)):
    with zipfile.ZipFile(os.path.join(out, label + '.zip'), 'w', method) as z:
        tree(z)
with zipfile.ZipFile(os.path.join(out, 'forced64.zip'), 'w', zipfile.ZIP_DEFLATED) as z:
    for name in ('dir/a.txt', 'dir/with space.txt'):
        info = zipfile.ZipInfo.from_file(name)
        info.compress_type = zipfile.ZIP_DEFLATED
        with open(name, 'rb') as source, z.open(info, 'w', force_zip64=True) as target:
            target.write(source.read())
with zipfile.ZipFile(os.path.join(out, 'many.zip'), 'w', allowZip64=True) as z:
    for i in range(65600):
        z.writestr(zipfile.ZipInfo('many/%05d' % i, (2021, 3, 4, 5, 6, 0)), b'')
)PY";
    writeFile(directory.file("make.py"), bytesOf(script));
    run("python3 " + out("make.py") + " " + out(""));
    for (const char* name : {"stored.zip", "deflated.zip", "bzip2.zip", "forced64.zip"}) {
        SCOPED_TRACE(name);
        expectSameListing(name, 2);
    }
    expectSameListing("many.zip", 65600);
    auto many = GWZipArchive::initWithURL(directory.url("many.zip"), nullptr);
    ASSERT_TRUE(many);
    EXPECT_EQ(countNodes(many->files()), 65601u);
}

TEST_F(GWZipArchivePeers, BsdtarZipFormat) {
    if (!toolAvailable("bsdtar")) {
        GTEST_SKIP() << "bsdtar is not installed";
    }
    run("bsdtar --format zip -cf " + out("bsdtar.zip") + " dir empty zero");
    expectSameListing("bsdtar.zip", 8);
}

TEST_F(GWZipArchivePeers, SevenZipZipFormat) {
    if (!toolAvailable("7zz")) {
        GTEST_SKIP() << "7zz is not installed";
    }
    run("7zz a -tzip -bd " + out("7z.zip") + " dir empty zero > /dev/null");
    expectSameListing("7z.zip", 8);
}

}  // namespace
