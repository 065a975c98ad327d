#include "support/HostileArchives.h"

#include "support/ContainmentSupport.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"

namespace gwtest {

namespace {

const GWData kEvil = bytesOf("written by a hostile archive");

GWData zipOf(const std::function<void(ZipBuilder&)>& fill) {
    ZipBuilder zip;
    fill(zip);
    return zip.bytes();
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
    static const std::vector<HostileArchive> archives{
        {"DotDotNames",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 zip.addFile("../canary", kEvil);
                 zip.addFile("../x", kEvil);
             });
         },
         ""},
        {"DotDotInsideNames",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 zip.addFile("a/../../canary", kEvil);
                 zip.addFile("a/b/../../../sub/kept", kEvil);
             });
         },
         ""},
        {"AbsoluteNames",
         [](const std::string& parent) {
             return zipOf([&](ZipBuilder& zip) {
                 zip.addFile(parent + "/canary", kEvil);
                 zip.addFile("/tmp/x", kEvil);
             });
         },
         ""},
        {"DirectoryThenLinkInItsPlace",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 zip.addDirectory("d/").externalAttributes = 040700u << 16;
                 zip.addSymlink("d", "..");
             });
         },
         ""},
        {"LinkToParentThenFile",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 zip.addSymlink("link", "..");
                 zip.addFile("link/canary", kEvil);
             });
         },
         "link/canary"},
        {"AbsoluteLinkThenFile",
         [](const std::string& parent) {
             return zipOf([&](ZipBuilder& zip) {
                 zip.addSymlink("link", parent);
                 zip.addFile("link/canary", kEvil);
             });
         },
         "link/canary"},
        {"LinkThenDirectoryThenFile",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 zip.addSymlink("link", "..");
                 zip.addDirectory("link/sub/");
                 zip.addFile("link/sub/kept", kEvil);
             });
         },
         "link/sub"},
        {"LinkThenSameNamedFile",
         [](const std::string& parent) {
             return zipOf([&](ZipBuilder& zip) {
                 zip.addSymlink("x", parent + "/canary");
                 zip.addFile("x", kEvil);
             });
         },
         ""},
        {"ZipItFilenameClimbing",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 addRenamedFile(zip, zipExtraBlock(0x2605, zipItPayload("../../canary", "TEXT",
                                                                        "ttxt", std::nullopt)));
             });
         },
         ""},
        {"SmartZipFilenameClimbing",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 SmartZipInfo info;
                 info.name = "../../canary";
                 addRenamedFile(zip, zipExtraBlock(0x4D63, smartZipPayload(info)));
             });
         },
         ""},
        {"POSIXPathClimbing",
         [](const std::string&) {
             return zipOf([](ZipBuilder& zip) {
                 addRenamedFile(zip, zipExtraBlock(0x7075, infoZipUnicodePayload("../..")));
             });
         },
         ""},
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
