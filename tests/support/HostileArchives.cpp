#include "support/HostileArchives.h"

#include "support/ContainmentSupport.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"

namespace gwtest {

namespace {

const GWData kEvil = bytesOf("written by a hostile archive");

// The archive `fill` builds for the sandbox whose parent folder it is given.
HostileArchive zipCase(std::string name, std::string refusedPath,
                       std::function<void(ZipBuilder&, const std::string& parent)> fill) {
    return {std::move(name),
            [fill](const std::string& parent) {
                ZipBuilder zip;
                fill(zip, parent);
                return zip.bytes();
            },
            std::move(refusedPath)};
}

// A plain file entry whose local and central extra fields are `extra`.
void addRenamedFile(ZipBuilder& zip, const GWData& extra) {
    ZipEntry& entry = zip.addFile("x", kEvil);
    entry.centralExtra = extra;
    entry.localExtra = extra;
}

std::string xarFile(const std::string& id, const std::string& name, const std::string& body) {
    return "<file id=\"" + id + "\"><name>" + name + "</name>" + body + "</file>";
}

GWData xarOf(const std::function<std::string(XarBuilder&)>& files) {
    XarBuilder xar;
    xar.setFiles(files(xar));
    return xar.bytes();
}

std::string regular(XarBuilder& xar) {
    return "<type>file</type>" + xar.dataElement("data", kEvil, XarEncoding::none);
}

}  // namespace

const std::vector<HostileArchive>& hostileZipArchives() {
    using P = const std::string&;
    static const std::vector<HostileArchive> archives{
        zipCase("DotDotNames", "",
                [](ZipBuilder& zip, P) {
                    zip.addFile("../canary", kEvil);
                    zip.addFile("../x", kEvil);
                }),
        zipCase("DotDotInsideNames", "",
                [](ZipBuilder& zip, P) {
                    zip.addFile("a/../../canary", kEvil);
                    zip.addFile("a/b/../../../sub/kept", kEvil);
                }),
        zipCase("AbsoluteNames", "",
                [](ZipBuilder& zip, P parent) {
                    zip.addFile(parent + "/canary", kEvil);
                    zip.addFile("/tmp/x", kEvil);
                }),
        zipCase("DirectoryThenLinkInItsPlace", "",
                [](ZipBuilder& zip, P) {
                    zip.addDirectory("d/").externalAttributes = 040700u << 16;
                    zip.addSymlink("d", "..");
                }),
        zipCase("LinkToParentThenFile", "link/canary",
                [](ZipBuilder& zip, P) {
                    zip.addSymlink("link", "..");
                    zip.addFile("link/canary", kEvil);
                }),
        zipCase("AbsoluteLinkThenFile", "link/canary",
                [](ZipBuilder& zip, P parent) {
                    zip.addSymlink("link", parent);
                    zip.addFile("link/canary", kEvil);
                }),
        zipCase("LinkThenDirectoryThenFile", "link/sub",
                [](ZipBuilder& zip, P) {
                    zip.addSymlink("link", "..");
                    zip.addDirectory("link/sub/");
                    zip.addFile("link/sub/kept", kEvil);
                }),
        zipCase("LinkThenSameNamedFile", "",
                [](ZipBuilder& zip, P parent) {
                    zip.addSymlink("x", parent + "/canary");
                    zip.addFile("x", kEvil);
                }),
        zipCase("ZipItFilenameClimbing", "",
                [](ZipBuilder& zip, P) {
                    addRenamedFile(zip, zipExtraBlock(0x2605, zipItPayload("../../canary", "TEXT",
                                                                           "ttxt", std::nullopt)));
                }),
        zipCase("SmartZipFilenameClimbing", "",
                [](ZipBuilder& zip, P) {
                    SmartZipInfo info;
                    info.name = "../../canary";
                    addRenamedFile(zip, zipExtraBlock(0x4D63, smartZipPayload(info)));
                }),
        zipCase("POSIXPathClimbing", "",
                [](ZipBuilder& zip, P) {
                    addRenamedFile(zip, zipExtraBlock(0x7075, infoZipUnicodePayload("../..")));
                }),
    };
    return archives;
}

const std::vector<HostileArchive>& hostileXARArchives() {
    static const std::vector<HostileArchive> archives{
        {"DotDotName",
         [](const std::string&) {
             return xarOf([](XarBuilder& xar) { return xarFile("1", "..", regular(xar)); });
         },
         ""},
        {"ClimbingName",
         [](const std::string&) {
             return xarOf([](XarBuilder& xar) {
                 return xarFile(
                     "1", "d",
                     "<type>directory</type>" + xarFile("2", "../../canary", regular(xar)));
             });
         },
         ""},
        {"AbsoluteName",
         [](const std::string& parent) {
             return xarOf(
                 [&](XarBuilder& xar) { return xarFile("1", parent + "/canary", regular(xar)); });
         },
         ""},
        {"HardLinkThroughLink",
         [](const std::string& parent) {
             // "d/link" leads out; "d/link/canary" is the target the hard
             // link would share, which is the parent's canary on disk.
             return xarOf([&](XarBuilder& xar) {
                 const std::string target =
                     "<type>file</type>" + xar.dataElement("data",
                                                           bytesOf(ContainmentSandbox::kCanaryText),
                                                           XarEncoding::none);
                 return xarFile(
                     "1", "d",
                     "<type>directory</type>" +
                         xarFile("2", "link",
                                 "<type>symlink</type><link type=\"file\">" + parent + "</link>" +
                                     xarFile("3", "canary", target)) +
                         xarFile(
                             "4", "hard",
                             "<type link=\"3\">hardlink</type>" +
                                 xar.dataElement("data", bytesOf(ContainmentSandbox::kCanaryText),
                                                 XarEncoding::none)));
             });
         },
         "d/hard"},
    };
    return archives;
}

}  // namespace gwtest
