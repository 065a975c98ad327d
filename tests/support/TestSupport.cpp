#include "TestSupport.h"

#include <sys/mount.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <stdexcept>

namespace gwtest {

TemporaryDirectory::TemporaryDirectory() {
    const char* base = std::getenv("TMPDIR");
    std::string pattern = std::string(base && *base ? base : "/tmp") + "/gwarchive-test-XXXXXX";
    if (!mkdtemp(pattern.data())) {
        throw std::runtime_error("mkdtemp failed");
    }
    path_ = pattern;
}

TemporaryDirectory::~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

SmallFileSystem::SmallFileSystem(std::uint64_t bytes) {
    const std::string size = "size=" + std::to_string(bytes);
    mounted_ = ::mount("tmpfs", directory_.path().c_str(), "tmpfs", 0, size.c_str()) == 0;
}

SmallFileSystem::~SmallFileSystem() {
    if (mounted_) {
        ::umount2(directory_.path().c_str(), MNT_DETACH);
    }
}

ScopedEnvironment::ScopedEnvironment(const char* name, const std::string& value) : name_(name) {
    if (const char* old = std::getenv(name)) {
        previous_ = old;
    }
    setenv(name, value.c_str(), 1);
}

ScopedEnvironment::~ScopedEnvironment() {
    if (previous_) {
        setenv(name_, previous_->c_str(), 1);
    } else {
        unsetenv(name_);
    }
}

void writeFile(const std::string& path, const GWData& bytes) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char*>(bytes.data()), std::streamsize(bytes.size()));
}

GWData readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return GWData(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

CommandResult runCommand(const std::string& command) {
    CommandResult result;
    FILE* pipe = popen(command.c_str(), "r");
    if (!pipe) {
        return result;
    }
    char buffer[4096];
    std::size_t n;
    while ((n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0) {
        result.output.append(buffer, n);
    }
    const int status = pclose(pipe);
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return result;
}

bool toolAvailable(const std::string& name) {
    return runCommand("command -v " + shellQuote(name) + " >/dev/null 2>&1").status == 0;
}

std::string shellQuote(const std::string& text) {
    std::string quoted = "'";
    for (char c : text) {
        quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return quoted + "'";
}

std::string hex(const GWData& bytes) {
    static const char kHex[] = "0123456789abcdef";
    std::string text;
    for (std::uint8_t b : bytes) {
        text += kHex[b >> 4];
        text += kHex[b & 15];
    }
    return text;
}

GWData bytesOf(const std::string& text) {
    return GWData(text.begin(), text.end());
}

GWData randomBytes(std::size_t count, std::uint32_t seed) {
    std::mt19937 generator(seed);
    GWData bytes(count);
    for (auto& b : bytes) {
        b = std::uint8_t(generator());
    }
    return bytes;
}

GWData textBytes(std::size_t count, std::uint32_t seed) {
    static const char* const kWords[] = {"archive",   "resource", "fork",     "finder",
                                         "the",       "of",       "metadata", "central",
                                         "directory", "a",        "heap",     "toc"};
    std::mt19937 generator(seed);
    GWData bytes;
    bytes.reserve(count);
    while (bytes.size() < count) {
        const std::string word = kWords[generator() % 12];
        bytes.insert(bytes.end(), word.begin(), word.end());
        bytes.push_back(generator() % 9 == 0 ? '\n' : ' ');
    }
    bytes.resize(count);
    return bytes;
}

}  // namespace gwtest
