#include <fcntl.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <regex>

#include "ToolTestSupport.h"
#include "support/AppleDoubleBuilder.h"
#include "support/MacBinaryBuilder.h"
#include "support/XarBuilder.h"
#include "support/XarSigning.h"
#include "support/ZipBuilder.h"
#include "xar/XarSignatureTestSupport.h"

using namespace gwtest;
namespace fs = std::filesystem;

namespace {

// "gwarchive: ARCHIVE[: PATH]: description", the domain and code left to -v.
::testing::AssertionResult isErrorLine(const std::string& text, const std::string& archive) {
    std::regex line("^gwarchive: " +
                    std::regex_replace(archive, std::regex(R"([.^$|()\[\]{}*+?\\])"), R"(\$&)") +
                    ": (?:(?!ErrorDomain).)+\n$");
    if (std::regex_match(text, line))
        return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "not one error line: " << text;
}

std::string pythonJSON(const std::string& json, const std::string& expression) {
    std::string script = "import json,sys\nd=json.load(sys.stdin)\n" + expression;
    TemporaryDirectory scratch;
    writeFile(scratch.file("in.json"), bytesOf(json));
    return runCommand("python3 -c " + shellQuote(script) + " < " +
                      shellQuote(scratch.file("in.json")))
        .output;
}

}  // namespace

// --- Usage and errors ---------------------------------------------------------

TEST(GWArchiveTool, UsageErrorsExitTwoAndHelpExitsZero) {
    for (const char* usage :
         {"", "frobnicate x", "list", "list --bogus a.zip", "cat a.zip", "extract -C",
          "list --encoding NO-SUCH-CHARSET a.zip", "extract --strip-components -1 a.zip"})
        EXPECT_EQ(runTool(usage).status, 2) << usage;
    for (const char* command :
         {"list", "extract", "cat", "test", "info", "detect", "macbinary", "appledouble"}) {
        ToolRun help = runTool(std::string(command) + " --help");
        EXPECT_EQ(help.status, 0) << command;
        EXPECT_NE(help.out.find("SYNOPSIS"), std::string::npos) << command;
        EXPECT_NE(help.out.find("EXIT STATUS"), std::string::npos) << command;
        // Every option has an example (-h and -v aside).
        const std::size_t options = help.out.find("\nOPTIONS\n");
        const std::size_t examples = help.out.find("\nEXAMPLE");
        if (options == std::string::npos)
            continue;
        const std::string listed = help.out.substr(options, help.out.find("\nEXIT") - options);
        std::smatch option;
        for (auto at = listed.cbegin();
             std::regex_search(at, listed.cend(), option, std::regex("--[a-z-]+"));
             at = option[0].second) {
            const std::string name = option.str();
            if (name != "--help" && name != "--verbose" && name != "--long") {
                EXPECT_NE(help.out.find(name, examples), std::string::npos) << command << name;
            }
        }
    }
    EXPECT_EQ(runTool("--help").status, 0);
}

// Hidden build folders anywhere below `root`.
static std::vector<std::string> leftovers(const std::string& root) {
    std::vector<std::string> found;
    for (const auto& item : fs::recursive_directory_iterator(root))
        if (item.path().filename().string().rfind(".gwarchive", 0) == 0)
            found.push_back(item.path().string());
    return found;
}

// Existing items are refused, then replaced with --overwrite, which merges into
// folders without touching what else they hold; an unreadable entry fails alone.
TEST(GWArchiveTool, ReExtractingMergesRefusesOrReplacesAndLeavesNothingBehind) {
    ZipBuilder zip;
    zip.addDirectory("d/");
    zip.addFile("d/a.txt", bytesOf("new a"), 8);
    zip.addFile("b.txt", bytesOf("new b"), 8);
    XarBuilder xar;
    std::string unreadable = xar.dataElement("data", bytesOf("c"), XarEncoding::gzip);
    unreadable.replace(unreadable.find("x-gzip"), 6, "x-lzma");
    auto file = [](int id, const std::string& name, const std::string& inner) {
        return "<file id=\"" + std::to_string(id) + "\"><name>" + name +
               "</name><type>file</type>" + inner + "</file>";
    };
    xar.setFiles("<file id=\"1\"><name>d</name><type>directory</type>" +
                 file(2, "a.txt", xar.dataElement("data", bytesOf("new a"), XarEncoding::gzip)) +
                 file(3, "c.txt", unreadable) + "</file>" +
                 file(4, "b.txt", xar.dataElement("data", bytesOf("new b"), XarEncoding::none)));
    TemporaryDirectory directory;
    ScopedEnvironment temporary("TMPDIR", directory.file("tmp"));
    fs::create_directories(directory.file("tmp"));
    writeFile(directory.file("t.zip"), zip.bytes());
    writeFile(directory.file("t.xar"), xar.bytes());
    for (const std::string name : {"t.zip", "t.xar"}) {
        SCOPED_TRACE(name);
        const bool isXar = name == "t.xar";
        const std::string out = directory.file("out-" + name), archive = directory.file(name);
        fs::create_directories(out + "/d");
        writeFile(out + "/d/a.txt", bytesOf("old a"));
        writeFile(out + "/d/mine", bytesOf("the user's"));
        const std::string arguments = "-C " + shellQuote(out) + " " + shellQuote(archive);
        ToolRun first = runTool("extract " + arguments);
        EXPECT_EQ(first.status, 1);
        EXPECT_EQ(first.err.rfind("gwarchive: " + archive + ": d/a.txt: ", 0), 0u) << first.err;
        EXPECT_EQ(std::count(first.err.begin(), first.err.end(), '\n'), isXar ? 2 : 1);
        EXPECT_EQ(readFile(out + "/d/a.txt"), bytesOf("old a"));
        EXPECT_EQ(readFile(out + "/b.txt"), bytesOf("new b"));

        ToolRun second = runTool("extract --overwrite " + arguments);
        EXPECT_EQ(second.status, isXar ? 1 : 0) << second.err;
        EXPECT_TRUE(isXar ? isErrorLine(second.err, archive + ": d/c.txt")
                          : ::testing::AssertionResult(second.err.empty()))
            << second.err;
        EXPECT_EQ(readFile(out + "/d/a.txt"), bytesOf("new a"));
        EXPECT_EQ(readFile(out + "/d/mine"), bytesOf("the user's"));
        EXPECT_FALSE(fs::exists(out + "/d/c.txt"));
        EXPECT_TRUE(fs::is_empty(directory.file("tmp")));
        EXPECT_EQ(leftovers(out), std::vector<std::string>{});
    }
}

// Runs the tool as `nobody` in a child process that may live 5 s at most.
static int runToolUnprivileged(const std::vector<std::string>& arguments) {
    const pid_t child = fork();
    if (child == 0) {
        alarm(5);
        if (setgid(65534) != 0 || setuid(65534) != 0)
            _exit(97);
        std::vector<char*> argv{const_cast<char*>(GW_TOOL_PATH)};
        for (const auto& word : arguments)
            argv.push_back(const_cast<char*>(word.c_str()));
        argv.push_back(nullptr);
        const int null = open("/dev/null", O_WRONLY);
        dup2(null, STDERR_FILENO);
        execv(GW_TOOL_PATH, argv.data());
        _exit(98);
    }
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

TEST(GWArchiveTool, ExtractingWhereTheUserMayNotWriteEndsWithAnError) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root to become another user";
    TemporaryDirectory directory;
    chmod(directory.path().c_str(), 0755);
    ZipBuilder zip;
    zip.addDirectory("d/");
    zip.addFile("d/a.txt", bytesOf("a"), 8);
    zip.addFile("b.txt", bytesOf("b"));
    writeFile(directory.file("t.zip"), zip.bytes());
    XarBuilder xar;
    xar.setFiles(
        "<file id=\"1\"><name>d</name><type>directory</type><file id=\"2\"><name>a</name>"
        "<type>file</type>" +
        xar.dataElement("data", bytesOf("a"), XarEncoding::gzip) + "</file></file>");
    writeFile(directory.file("t.xar"), xar.bytes());
    fs::create_directories(directory.file("closed"));
    fs::create_directories(directory.file("open"));
    chmod(directory.file("open").c_str(), 0777);
    std::string tooLong = directory.file("open");
    while (tooLong.size() <= PATH_MAX)
        tooLong += "/" + std::string(200, 'x');
    for (const char* archive : {"t.zip", "t.xar"}) {
        for (const std::string& destination : {directory.file("closed"), tooLong}) {
            const int status = runToolUnprivileged(
                {"extract", "--no-progress", "-C", destination, directory.file(archive)});
            EXPECT_EQ(status, 1) << archive << " into " << destination.substr(0, 80);
        }
    }
}

TEST(GWArchiveTool, AnInterruptedExtractionLeavesNoBuildFolders) {
    TemporaryDirectory directory;
    const GWData block = randomBytes(20 * 1024, 7);
    StreamingZipWriter writer(directory.file("big.zip"));
    for (int i = 0; i < 15000; ++i)
        writer.add("dir" + std::to_string(i % 50) + "/file" + std::to_string(i), block);
    ASSERT_TRUE(writer.finish());
    fs::create_directories(directory.file("tmp"));
    fs::create_directories(directory.file("out"));
    const pid_t child = fork();
    if (child == 0) {
        setenv("TMPDIR", directory.file("tmp").c_str(), 1);
        const int null = open("/dev/null", O_WRONLY);
        dup2(null, STDERR_FILENO);
        execl(GW_TOOL_PATH, GW_TOOL_PATH, "extract", "--no-progress", "-C",
              directory.file("out").c_str(), directory.file("big.zip").c_str(), nullptr);
        _exit(98);
    }
    usleep(300000);
    kill(child, SIGINT);
    int status = 0;
    waitpid(child, &status, 0);
    ASSERT_TRUE(WIFSIGNALED(status)) << "the extraction ended before it was interrupted";
    EXPECT_EQ(WTERMSIG(status), SIGINT);
    EXPECT_TRUE(fs::is_empty(directory.file("tmp")));
    EXPECT_EQ(leftovers(directory.file("out")), std::vector<std::string>{});
}

TEST(GWArchiveTool, ControlCharactersInNamesAreEscapedExceptInJson) {
    const std::vector<std::string> names = {"esc\x1b[2J", "cr\rx",
                                            "lf\nx",      "x\ngwarchive: t.zip: forged (POSIX 1)",
                                            "c1\xc2\x9b", "q\"uote\\d"};
    ZipBuilder zip;
    for (const std::string& name : names)
        zip.addFile(name, bytesOf("x")).crc32 = 1;  // so that test and extract name them too
    zip.addSymlink("link", "t\x1b]0;title\x07");
    TemporaryDirectory directory;
    writeFile(directory.file("t.zip"), zip.bytes());
    const std::string out = shellQuote(directory.file("out"));
    // Lines on both streams: every entry, or every bad one (and test's summary).
    for (const auto& [command, lines] : {std::pair<std::string, int>{"list", 7},
                                         {"list -l", 8},
                                         {"test", 7},
                                         {"extract --no-progress -C " + out, 6}}) {
        ToolRun run = runTool(command + " " + shellQuote(directory.file("t.zip")));
        const std::string text = run.out + run.err;
        EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), lines) << command << "\n" << text;
        EXPECT_TRUE(std::none_of(text.begin(), text.end(), [](char c) {
            return (c > 0 && c < 0x20 && c != '\n') || c == 0x7F;
        })) << text;
        EXPECT_EQ(text.find("\xc2\x9b"), std::string::npos) << command;
        EXPECT_NE(text.find("lf\\012x"), std::string::npos) << text;
    }
    ToolRun json = runTool("list --json " + shellQuote(directory.file("t.zip")));
    std::vector<std::string> sorted = names;
    sorted.push_back("link");
    std::sort(sorted.begin(), sorted.end());
    std::string expected;
    for (const std::string& name : sorted)
        expected += name + "|";
    EXPECT_EQ(pythonJSON(json.out,
                         "e = sorted(d['entries'], key=lambda e: e['path'])\n"
                         "print(''.join(x['path'] + '|' for x in e), end='')\n"
                         "print([x.get('linkTarget') for x in e if x['path'] == "
                         "'link'][0], end='')"),
              expected + "t\x1b]0;title\x07");
}

TEST(GWArchiveTool, EncryptedEntriesTakeTheirPasswordFromAnOptionAFileOrTheTerminal) {
    TemporaryDirectory directory;
    const GWData content = textBytes(20000, 6);
    writeFile(directory.file("a.txt"), content);
    writeFile(directory.file("password"), bytesOf("secret\nnot this line\n"));
    const std::string folder = shellQuote(directory.path());
    const struct {
        const char* tool;
        const char* command;
        bool checksPassword;  // a verifier that a wrong password cannot pass by chance
    } archives[] = {{"zip", "zip -q -e -P secret e.zip a.txt", false},
                    {"7zz", "7zz a -tzip -mem=AES256 -psecret e.zip a.txt >/dev/null", true}};
    for (const auto& made : archives) {
        if (!toolAvailable(made.tool))
            continue;
        SCOPED_TRACE(made.tool);
        fs::remove(directory.file("e.zip"));
        ASSERT_EQ(runCommand("cd " + folder + " && " + made.command).status, 0);
        const std::string archive = shellQuote(directory.file("e.zip"));
        EXPECT_EQ(pythonJSON(runTool("list --json " + archive).out,
                             "print([(e['encrypted'], e['compression']) for e in d['entries']])"),
                  "[(True, 'deflate')]\n");
        EXPECT_NE(runTool("list -l " + archive).out.find(" a.txt  [encrypted]\n"),
                  std::string::npos);
        const std::string file = " --password-file " + shellQuote(directory.file("password"));
        const std::string out = shellQuote(directory.file("out"));
        const struct {
            std::string arguments;
            int status;
            std::string errorCode;  // the end of the error line; empty: no error
        } rows[] = {
            {"cat --password secret " + archive + " a.txt", 0, ""},
            {"cat" + file + " " + archive + " a.txt", 0, ""},
            {"cat " + archive + " a.txt", 1,
             "a.txt: encrypted: password required (--password or --password-file)\n"},
            {"cat --password Secret " + archive + " a.txt", 1,
             made.checksPassword ? "a.txt: wrong password\n" : ""},
            {"test " + archive, 1, ""},
            {"test --password secret " + archive, 0, ""},
            {"extract -v -C " + out + " " + archive, 1, "(GWZipArchiveErrorDomain 8)\n"},
            {"extract -C " + out + file + " " + archive, 0, ""},
            {"extract -C " + out + " --password-file /nonexistent " + archive, 1,
             "/nonexistent: not found\n"},
        };
        for (const auto& row : rows) {
            fs::remove_all(directory.file("out"));
            ToolRun run = runTool(row.arguments);
            EXPECT_EQ(run.status, row.status) << row.arguments << run.err;
            if (row.status == 0 && row.arguments.starts_with("cat")) {
                EXPECT_TRUE(bytesOf(run.out) == content) << row.arguments;
            }
            if (row.arguments.starts_with("extract")) {
                EXPECT_TRUE(row.status == 0 ? readFile(directory.file("out/a.txt")) == content
                                            : !fs::exists(directory.file("out/a.txt")))
                    << row.arguments;
            }
            if (row.status == 0) {
                EXPECT_EQ(run.err, "") << row.arguments;
            } else if (!row.errorCode.empty()) {
                EXPECT_TRUE(run.err.ends_with(row.errorCode)) << row.arguments << run.err;
            }
        }
        if (toolAvailable("script")) {
            // Asked once on the terminal, and not echoed once asked.
            const std::string command = std::string(GW_TOOL_PATH) + " test " + archive;
            CommandResult terminal = runCommand("(sleep 2; printf 'secret\\n') | script -qfec " +
                                                shellQuote(command) + " /dev/null");
            EXPECT_EQ(terminal.status, 0) << terminal.output;
            EXPECT_NE(terminal.output.find("Password for "), std::string::npos) << terminal.output;
            EXPECT_EQ(terminal.output.find("secret"), std::string::npos) << terminal.output;
            EXPECT_NE(terminal.output.find("1 entries, 0 bad"), std::string::npos);
        }
    }
}

// --- XAR archives ---------------------------------------------------------------

// --- habits: selection, existing items, quiet and verbose, messages -------------

namespace {

// `pattern` with "*" for any text without a comma or line break, "**" for any
// text without a line break, "***" for anything at all.
bool matchesLoosely(const std::string& pattern, const std::string& text) {
    std::string expression;
    for (std::size_t at = 0; at < pattern.size();) {
        if (pattern.compare(at, 3, "***") == 0) {
            expression += "[\\s\\S]*";
            at += 3;
        } else if (pattern.compare(at, 2, "**") == 0) {
            expression += "[^\\n]*";
            at += 2;
        } else if (pattern[at] == '*') {
            expression += "[^,\\n]*";
            ++at;
        } else {
            expression += std::regex_replace(std::string(1, pattern[at++]),
                                             std::regex(R"([.^$|()\[\]{}+?\\])"), R"(\$&)");
        }
    }
    return std::regex_match(text, std::regex(expression));
}

}  // namespace

TEST(GWArchiveTool, CommandLineHabitsTable) {
    TemporaryDirectory directory;
    ScopedEnvironment zone("TZ", "UTC");
    ZipBuilder zip;
    zip.addDirectory("docs/");
    zip.addFile("docs/a.txt", bytesOf("alpha"));
    zip.addFile("docs/b.md", bytesOf("bravo"));
    zip.addFile("docs/sub/c.txt", bytesOf("charlie"));  // docs/sub is implied
    zip.addFile("lib/x.txt", bytesOf("xray")).dosDate = zipDOSDate(2021, 6, 1);
    zip.addFile("top.txt", bytesOf("top"));
    zip.addFile("bad.txt", bytesOf("damaged")).crc32 = 1;
    writeFile(directory.file("z.zip"), zip.bytes());
    ZipBuilder mac;
    mac.addDirectory("d/");
    mac.addFile("d/f", bytesOf("f"));
    mac.addFile("__MACOSX/d/._f", buildAppleDouble({}));
    writeFile(directory.file("mac.zip"), mac.bytes());
    ZipBuilder sfx;
    sfx.prefix = GWData(80, 0);  // a DOS stub of four header paragraphs, then its marker
    std::copy_n("MZ", 2, sfx.prefix.begin());
    sfx.prefix[8] = 4;
    std::copy_n("PKSFX", 5, sfx.prefix.begin() + 68);
    sfx.offsetsIncludePrefix = true;
    sfx.addFile("s", bytesOf("s"));
    writeFile(directory.file("sfx.zip"), sfx.bytes());
    XarBuilder xar;
    xar.setFiles(
        "<file id=\"1\"><name>d</name><type>directory</type><file id=\"2\"><name>e</name>"
        "<type>file</type>" +
        xar.dataElement("data", bytesOf("e"), XarEncoding::none) +
        "</file><file id=\"3\"><name>f</name><type>file</type>" +
        xar.dataElement("data", bytesOf("f"), XarEncoding::none) + "</file></file>");
    writeFile(directory.file("x.xar"), xar.bytes());
    writeFile(directory.file("n.txt"), bytesOf("plain text"));
    ZipBuilder cut;
    cut.addFile("a.txt", textBytes(5000, 4), 8);
    GWData cutBytes = cut.bytes();
    cutBytes.resize(cutBytes.size() - 30);
    writeFile(directory.file("cut.zip"), cutBytes);

    const struct {
        std::string command;  // Z, M, S, X, CUT: archives; N: none; OUT: a folder; GW: the tool
        int status;
        std::string out;  // patterns for matchesLoosely
        std::string err;
    } rows[] = {
        {"detect Z S X N", 0, "Z: zip\nS: zip (self-extracting)\nX: xar\nN: unknown\n", ""},
        {"detect OUT", 1, "", "gwarchive: OUT: **\n"},
        {"macbinary N OUT/n", 1, "", "gwarchive: N: **\n"},
        // Missing, no archive, or cut short: one error line and status 1; what the
        // lost directory held is recovered, and said once.
        {"list N", 1, "", "gwarchive: N: **\n"},
        {"info OUT/none", 1, "", "gwarchive: OUT/none: **\n"},
        {"test -v OUT/none", 1, "", "gwarchive: OUT/none: ** (NSPOSIXErrorDomain 2)\n"},
        {"extract -C OUT N", 1, "", "gwarchive: N: **\n"},
        {"test CUT", 1, "***",
         "gwarchive: CUT: central directory missing: 1 entries recovered from local headers\n"},
        {"extract -C OUT/cut CUT", 1, "",
         "gwarchive: CUT: central directory missing: 1 entries recovered from local headers\n"},
        // Selection by name, glob, folder, --include and --exclude; an unmatched PATH.
        {"list Z 'docs/*.txt'", 0, "docs/a.txt\n", ""},
        {"list Z nope 'docs/**.txt' top.txt", 1, "docs/a.txt\ndocs/sub/c.txt\ntop.txt\n",
         "gwarchive: Z: nope: no entry matches\n"},
        {"list Z docs --include '**.txt' --exclude docs/sub", 0, "docs/a.txt\n", ""},
        {"list Z --include '*.txt'", 0, "top.txt\nbad.txt\n", ""},
        // A made-up folder: the newest date below it, none in JSON, no Finder note.
        {"list -l Z lib", 0,
         "d** 2021-06-01 12:00 lib/\n-** 2021-06-01 12:00 lib/x.txt\n"
         "2 entries, 4 bytes, 4 compressed, 0% saved\n",
         ""},
        {"list --json Z lib", 0,
         "{\"format\":\"zip\",\"startOffset\":0,\"dataOffset\":0,\"entries\":[{\"path\":\"lib\","
         "\"type\":\"directory\",\"mode\":16877,\"size\":0,\"compressedSize\":0,\"mtime\":null,"
         "\"uid\":*,\"gid\":*,\"appleDouble\":false,**\n",
         ""},
        {"list -l M", 0, "d** d/  [fold/MACS]\n-** d/f  [AppleDouble]\n**saved\n", ""},
        // cat: PATHs in order, folders by their files, damage said plainly; standard
        // input from a file (read in place) and from a pipe (spooled).
        {"cat - top.txt < Z && cat Z | GW cat - docs/sub/c.txt", 0, "topcharlie", ""},
        {"cat Z top.txt 'docs/*.txt' top.txt", 0, "topalphatop", ""},
        {"cat Z docs/sub nope", 1, "charlie", "gwarchive: Z: nope: no entry matches\n"},
        {"cat Z bad.txt", 1, "damaged",
         "gwarchive: Z: bad.txt: checksum mismatch (data damaged)\n"},
        {"cat -v Z bad.txt", 1, "damaged",
         "***gwarchive: Z: bad.txt: checksum mismatch (data damaged) (GWZipArchiveErrorDomain "
         "5)\n"},
        // test: selected entries only; -q keeps the problems; JSON names domain and code.
        {"test Z 'docs/**'", 0, "Z: 4 entries, 0 bad\n", ""},
        {"test -q Z", 1, "bad.txt: checksum mismatch (data damaged)\n", ""},
        {"test --json Z bad.txt", 1,
         "**\"entries\":1,\"unverified\":0,\"bad\":[{\"path\":\"bad.txt\",\"error\":{\"domain\":"
         "\"GWZipArchiveErrorDomain\",\"code\":5,\"message\":\"checksum mismatch (data "
         "damaged)\"}}],\"error\":null,\"passed\":false}\n",
         ""},
        // Existing items: refused with a hint, kept, replaced; -v names what is written.
        {"extract -C OUT Z --exclude bad.txt", 0, "", ""},
        {"extract -C OUT Z top.txt", 1, "",
         "gwarchive: Z: top.txt: already exists (use --overwrite or --skip-existing)\n"},
        {"extract -v --skip-existing -C OUT Z --exclude bad.txt", 0,
         "Z: 0 written, 5 skipped (already there)\n", "***"},
        {"extract -v --overwrite -C OUT Z top.txt", 0,
         "top.txt\nZ: 1 written, 0 skipped (already there)\n", "***"},
        {"extract -q --progress --overwrite -C OUT Z top.txt", 0, "", ""},
        {"extract --overwrite --skip-existing -C OUT Z", 2, "", "**exclude each other\n"},
        // --strip-components: what has no more components is left out.
        {"extract -v --strip-components 2 -C OUT/s Z docs && ls OUT/s", 0,
         "c.txt\nZ: 1 written, 0 skipped (already there)\nc.txt\n", "***"},
        {"extract -v --strip-components 1 -C OUT/x X && ls OUT/x", 0,
         "e\nf\nX: 2 written, 0 skipped (already there)\ne\nf\n", "***"},
        {"extract -v --skip-existing --strip-components 1 -C OUT/x X", 0,
         "X: 0 written, 2 skipped (already there)\n", "***"},
        {"extract --strip-components 1 -C OUT/x X d/e", 1, "",
         "gwarchive: X: d/e: already exists (use --overwrite or --skip-existing)\n"},
        // Where a self-extractor's ZIP data begins, its offsets counted from the file's start.
        {"info S", 0,
         "archive: S\nformat: zip\nstart offset: 0\ndata begins at: 80 (80 bytes precede it)\n"
         "entries: 1 (0 directories, 1 others)\nbytes: 1 (1 compressed)\n",
         ""},
    };
    const std::pair<std::string, std::string> names[] = {
        {"Z", directory.file("z.zip")},     {"M", directory.file("mac.zip")},
        {"S", directory.file("sfx.zip")},   {"X", directory.file("x.xar")},
        {"N", directory.file("n.txt")},     {"GW", GW_TOOL_PATH},
        {"CUT", directory.file("cut.zip")}, {"OUT", directory.file("out")},
    };
    auto substitute = [&](std::string text) {
        for (const auto& [name, path] : names)
            text = std::regex_replace(text, std::regex("\\b" + name + "\\b"), path);
        return text;
    };
    for (const auto& row : rows) {
        ToolRun run = runTool(substitute(row.command));
        EXPECT_EQ(run.status, row.status) << row.command << "\n" << run.err;
        EXPECT_TRUE(matchesLoosely(substitute(row.out), run.out)) << row.command << "\n" << run.out;
        EXPECT_TRUE(matchesLoosely(substitute(row.err), run.err)) << row.command << "\n" << run.err;
    }
    EXPECT_EQ(readFile(directory.file("out/cut/a.txt")), textBytes(5000, 4));
    // Nothing in a listing depends on when it is made.
    EXPECT_EQ(runTool("list --json " + directory.file("z.zip")).out,
              runTool("list --json " + directory.file("z.zip")).out);
}

// --- test ----------------------------------------------------------------------

// How test, extract and info judge a XAR's checksums and signatures.
// `arguments` name the archive as ARCHIVE, the output directory as OUT and
// the test root certificate as ROOT.
enum class XarDamage { none, flippedData, tocChecksum, noChecksums, signedRSA, noSigners };

struct XarVerdict {
    const char* name;
    XarDamage damage;
    std::string arguments;
    int status;
    const char* out;  // part of standard output
    const char* err;  // the end of the one error line; "" for none
    bool writes;      // x.txt appears in OUT
};

void PrintTo(const XarVerdict& verdict, std::ostream* out) {
    *out << verdict.name;
}

class GWArchiveToolXarVerdict : public ::testing::TestWithParam<XarVerdict> {};

TEST_P(GWArchiveToolXarVerdict, FollowsTheChecksums) {
    const XarVerdict& verdict = GetParam();
    TemporaryDirectory directory;
    const bool checksums = verdict.damage != XarDamage::noChecksums;
    XarBuilder xar(checksums ? 1 : 0);
    xar.includeChecksumElement = checksums;
    xar.corruptStoredChecksum = verdict.damage == XarDamage::tocChecksum;
    const std::string data = xar.dataElement("data", bytesOf("xar content to flip"),
                                             XarEncoding::none, checksums ? "sha1" : "");
    xar.setFiles("<file id=\"1\"><name>x.txt</name><type>file</type>" + data + "</file>");
    XarSigning& signing = sharedSigning();
    if (verdict.damage == XarDamage::signedRSA || verdict.damage == XarDamage::noSigners) {
        XarSigning::Request request(verdict.damage == XarDamage::noSigners ? "CMS" : "RSA",
                                    signing.leaf(XarKeyType::rsa));
        request.withoutSigners = verdict.damage == XarDamage::noSigners;
        ASSERT_TRUE(signing.signArchive(xar, {request})) << signing.problem();
    }
    GWData bytes = xar.bytes();
    if (verdict.damage == XarDamage::flippedData) {
        const std::string text(bytes.begin(), bytes.end());
        bytes[text.find("to flip")] ^= 0x01;
    }
    const std::string archive = directory.file("a.xar");
    writeFile(archive, bytes);
    fs::create_directories(directory.file("out"));
    std::string arguments = verdict.arguments;
    arguments.replace(arguments.find("ARCHIVE"), 7, shellQuote(archive));
    if (auto at = arguments.find("OUT"); at != std::string::npos)
        arguments.replace(at, 3, shellQuote(directory.file("out")));
    if (auto at = arguments.find("ROOT"); at != std::string::npos)
        arguments.replace(at, 4, shellQuote(signing.rootCertificateFile()));

    const ToolRun run = runTool(arguments);
    EXPECT_EQ(run.status, verdict.status) << run.out << run.err;
    EXPECT_NE(run.out.find(verdict.out), std::string::npos) << run.out;
    if (*verdict.err) {
        EXPECT_TRUE(isErrorLine(run.err, archive));
        EXPECT_NE(run.err.find(verdict.err), std::string::npos) << run.err;
    } else {
        EXPECT_EQ(run.err, "");
    }
    EXPECT_EQ(fs::exists(directory.file("out/x.txt")), verdict.writes);
}

const char* const kTOCMismatch =
    "table of contents does not match its checksum (archive damaged)\n";

INSTANTIATE_TEST_SUITE_P(
    Archives, GWArchiveToolXarVerdict,
    ::testing::Values(
        XarVerdict{"TestPassesAGoodArchive", XarDamage::none, "test ARCHIVE", 0,
                   "1 entries, 0 bad\n", "", false},
        XarVerdict{"TestNamesAFlippedByte", XarDamage::flippedData, "test ARCHIVE", 1,
                   "x.txt: checksum mismatch (data damaged)", "", false},
        XarVerdict{"TestFailsABadTableOfContents", XarDamage::tocChecksum, "test ARCHIVE", 1, "",
                   kTOCMismatch, false},
        XarVerdict{"ExtractWritesNothingFromABadTableOfContents", XarDamage::tocChecksum,
                   "extract -C OUT ARCHIVE", 1, "", kTOCMismatch, false},
        XarVerdict{"ExtractCanIgnoreTheChecksum", XarDamage::tocChecksum,
                   "extract --ignore-checksum -C OUT ARCHIVE", 0, "", "", true},
        XarVerdict{"InfoReportsABadTableOfContents", XarDamage::tocChecksum, "info ARCHIVE", 0,
                   "checksum: INVALID\n", "", false},
        XarVerdict{"InfoSaysNoneWithoutChecksums", XarDamage::noChecksums, "info ARCHIVE", 0,
                   "checksum: none\n", "", false},
        XarVerdict{"JsonSaysNoneWithoutChecksums", XarDamage::noChecksums, "list --json ARCHIVE", 0,
                   "\"checksum\":\"none\"", "", false},
        XarVerdict{"TestCannotVerifyWithoutChecksums", XarDamage::noChecksums, "test ARCHIVE", 0,
                   "1 entries, 0 bad, 1 not verified (no stored checksum)\n", "", false},
        XarVerdict{"InfoTrustsAnAddedAnchor", XarDamage::signedRSA, "info --trust ROOT ARCHIVE", 0,
                   "signature: valid (GW Test RSA Signer, GW Test Root CA)\n"
                   "  RSA valid: \"GW Test RSA Signer\" \"GW Test Intermediate CA\"\n",
                   "", false},
        XarVerdict{"InfoSaysWhereAnUntrustedChainStops", XarDamage::signedRSA, "info ARCHIVE", 0,
                   "signature: untrusted (unknown issuer, GW Test RSA Signer, GW Test "
                   "Intermediate CA)\n",
                   "", false},
        XarVerdict{"InfoCallsAMessageWithoutSignersInvalid", XarDamage::noSigners,
                   "info --trust ROOT ARCHIVE", 0, "signature: INVALID (no signers)\n", "", false},
        XarVerdict{"ExtractRefusesAnUntrustedSignature", XarDamage::signedRSA,
                   "extract --require-signature -C OUT ARCHIVE", 1, "",
                   "Refused: the signature is untrusted (unknown issuer, GW Test RSA Signer, GW "
                   "Test Intermediate CA)\n",
                   false},
        XarVerdict{"ExtractTakesATrustedSignature", XarDamage::signedRSA,
                   "extract --require-signature --trust ROOT -C OUT ARCHIVE", 0, "", "", true},
        XarVerdict{"TestRequiresASignature", XarDamage::none, "test --require-signature ARCHIVE", 1,
                   "", "Refused: the signature is none\n", false},
        XarVerdict{
            "InfoJsonCarriesTheChain", XarDamage::signedRSA, "info --json --trust ROOT ARCHIVE", 0,
            "\"signature\":\"valid\",\"signatureReason\":\"\",\"signatures\":[{\"type\":"
            "\"RSA\",\"extended\":false,\"verdict\":\"valid\",\"reason\":\"\",\"certificates\":"
            "[\"GW Test RSA Signer\",\"GW Test Intermediate CA\"],\"chain\":[\"GW Test RSA "
            "Signer\",\"GW Test Intermediate CA\",\"GW Test Root CA\"]}]",
            "", false},
        XarVerdict{
            "TestJsonNamesTheBadEntry", XarDamage::flippedData, "test --json ARCHIVE", 1,
            "\"bad\":[{\"path\":\"x.txt\",\"error\":{\"domain\":\"NSCocoaErrorDomain\","
            "\"code\":259,\"message\":\"checksum mismatch (data damaged)\"}}],\"error\":null,"
            "\"passed\":false}",
            "", false},
        XarVerdict{"TestJsonCarriesTheRefusal", XarDamage::signedRSA,
                   "test --require-signature --json ARCHIVE", 1,
                   "\"bad\":[],\"error\":{\"domain\":\"GWXARArchiveErrorDomain\",\"code\":7,",
                   "Refused: the signature is untrusted (unknown issuer, GW Test RSA Signer, GW "
                   "Test Intermediate CA)\n",
                   false},
        XarVerdict{"TrustNeedsCertificates", XarDamage::none, "list --trust ARCHIVE ARCHIVE", 1, "",
                   "The trusted certificates hold no PEM certificate", false}),
    [](const auto& info) { return std::string(info.param.name); });

// --- detect, macbinary, appledouble ---------------------------------------------

TEST(GWArchiveTool, MacBinaryAndAppleDoubleCommandsRestoreForksAndFinderInfo) {
    TemporaryDirectory directory;
    MacBinaryFile file;
    file.name = "Letter";
    file.type = "TEXT";
    file.creator = "ttxt";
    file.dataFork = bytesOf("Dear reader");
    file.resourceFork = bytesOf("resource bytes");
    writeFile(directory.file("Letter.bin"), buildMacBinary(file));
    ToolRun decode = runTool("macbinary " + shellQuote(directory.file("Letter.bin")) + " " +
                             shellQuote(directory.file("Letter")));
    ASSERT_EQ(decode.status, 0) << decode.err;
    EXPECT_EQ(readFile(directory.file("Letter")), bytesOf("Dear reader"));
    char fork[64] = {};
    EXPECT_EQ(getxattr(directory.file("Letter").c_str(), "user.com.apple.ResourceFork", fork,
                       sizeof fork),
              14);

    AppleDoubleFile companion;
    companion.finderInfo = finderInfoBytes("APPL", "abcd");
    companion.resourceFork = bytesOf("fork");
    writeFile(directory.file("._App"), buildAppleDouble(companion));
    writeFile(directory.file("App"), bytesOf("data"));
    ToolRun merge = runTool("appledouble " + shellQuote(directory.file("._App")) + " " +
                            shellQuote(directory.file("App")));
    ASSERT_EQ(merge.status, 0) << merge.err;
    char info[32] = {};
    ASSERT_EQ(getxattr(directory.file("App").c_str(), "user.com.apple.FinderInfo", info, 32), 32);
    EXPECT_EQ(std::string(info, 8), "APPLabcd");
}

// --- progress -------------------------------------------------------------------

TEST(GWArchiveTool, ProgressBarIsDrawnOnATerminalOnly) {
    if (!toolAvailable("script"))
        GTEST_SKIP() << "script missing";
    TemporaryDirectory directory;
    std::string archive = directory.file("big.zip");
    // 200 MiB of zeros deflate to little, so the test stays small on disk.
    ASSERT_EQ(
        runCommand("python3 -c " +
                   shellQuote("import zipfile,sys\n"
                              "with zipfile.ZipFile(sys.argv[1], 'w', zipfile.ZIP_DEFLATED) as z:\n"
                              "    with z.open('zeros.bin', 'w', force_zip64=True) as f:\n"
                              "        block = bytes(1 << 20)\n"
                              "        for _ in range(200): f.write(block)\n") +
                   " " + shellQuote(archive))
            .status,
        0);
    std::string command = std::string(GW_TOOL_PATH) + " extract -C " +
                          shellQuote(directory.file("tty")) + " " + shellQuote(archive);
    CommandResult terminal = runCommand("script -qfec " + shellQuote(command) + " /dev/null");
    EXPECT_EQ(terminal.status, 0) << terminal.output;
    EXPECT_NE(terminal.output.find("200.0 MiB / 200.0 MiB"), std::string::npos) << terminal.output;
    EXPECT_NE(terminal.output.find("100%"), std::string::npos);
    EXPECT_NE(terminal.output.find("/s"), std::string::npos);

    ToolRun piped =
        runTool("extract -C " + shellQuote(directory.file("pipe")) + " " + shellQuote(archive));
    EXPECT_EQ(piped.status, 0);
    EXPECT_EQ(piped.err, "");
    EXPECT_EQ(fs::file_size(directory.file("pipe/zeros.bin")), 200u << 20);
}
