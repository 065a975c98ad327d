// Writes the two sample archives `make run` shows: a ZIP laid out as the Mac
// Finder makes them (AppleDouble companions under "__MACOSX") and a XAR with
// links and extended attributes. Both come from the test builders, so the
// samples are reproducible and need no tool the project does not install.

#include <cstdio>
#include <string>

#include "support/AppleDoubleBuilder.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"

using namespace gwtest;

namespace {

GWData macZip() {
    ZipBuilder zip;
    zip.addDirectory("Mac Sample/");
    zip.addFile("Mac Sample/Read Me.txt",
                bytesOf("This file came from a Mac.\nIts Finder information, resource fork and\n"
                        "extended attributes travel in __MACOSX/Mac Sample/._Read Me.txt.\n"),
                8);
    zip.addSymlink("Mac Sample/Latest", "Read Me.txt");
    AppleDoubleFile companion;
    companion.finderInfo = finderInfoBytes("TEXT", "ttxt");
    companion.attributes.push_back({"com.example.origin", bytesOf("made by gwarchive_samples")});
    companion.resourceFork = bytesOf("a small resource fork");
    zip.addDirectory("__MACOSX/");
    zip.addDirectory("__MACOSX/Mac Sample/");
    zip.addFile("__MACOSX/Mac Sample/._Read Me.txt", buildAppleDouble(companion), 8);
    return zip.bytes();
}

GWData linkedXar() {
    XarBuilder xar;
    std::string notes =
        xar.dataElement("data", bytesOf("Notes kept in a XAR archive.\n"), XarEncoding::gzip);
    std::string tag = xar.dataElement("ea", bytesOf("blue"), XarEncoding::none, "sha1",
                                      "<name>user.color</name>");
    const std::string owner =
        "<uid>1000</uid><gid>1000</gid><user>sample</user><group>sample</group>";
    xar.setFiles("<file id=\"1\"><name>Docs</name><type>directory</type><mode>0755</mode>" + owner +
                 "<mtime>2024-05-01T10:00:00Z</mtime>"
                 "<file id=\"2\"><name>notes.txt</name><type>file</type><mode>0644</mode>" +
                 owner + "<mtime>2024-05-01T10:00:00Z</mtime>" + notes + tag +
                 "</file>"
                 "<file id=\"3\"><name>notes-link.txt</name><type "
                 "link=\"2\">hardlink</type><mode>0644</mode>" +
                 owner + "<mtime>2024-05-01T10:00:00Z</mtime>" + notes +
                 "</file>"
                 "<file id=\"4\"><name>latest</name><type>symlink</type>"
                 "<link type=\"file\">notes.txt</link><mode>0755</mode>" +
                 owner +
                 "<mtime>2024-05-01T10:00:00Z</mtime></file>"
                 "</file>");
    return xar.bytes();
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: gwarchive_samples DIRECTORY\n");
        return 2;
    }
    std::string directory = argv[1];
    writeFile(directory + "/Mac Sample.zip", macZip());
    writeFile(directory + "/Linked.xar", linkedXar());
    std::printf("%s/Mac Sample.zip\n%s/Linked.xar\n", directory.c_str(), directory.c_str());
    return 0;
}
