#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWFoundation.h"

namespace gwtest {

// A fresh directory under $TMPDIR, removed with everything in it at the end.
class TemporaryDirectory {
public:
    TemporaryDirectory();
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    const std::string& path() const { return path_; }
    std::string file(const std::string& name) const { return path_ + "/" + name; }
    GWURL url(const std::string& name) const { return GWURL::fileURLWithPath(file(name)); }

private:
    std::string path_;
};

// A file system of `bytes` (tmpfs) mounted on a fresh directory, unmounted at
// the end; mounted() is false where this process may not mount.
class SmallFileSystem {
public:
    explicit SmallFileSystem(std::uint64_t bytes);
    ~SmallFileSystem();
    bool mounted() const { return mounted_; }
    const std::string& path() const { return directory_.path(); }

private:
    TemporaryDirectory directory_;
    bool mounted_ = false;
};

// Sets an environment variable for a scope, then restores what was there.
class ScopedEnvironment {
public:
    ScopedEnvironment(const char* name, const std::string& value);
    ~ScopedEnvironment();
    ScopedEnvironment(const ScopedEnvironment&) = delete;
    ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

private:
    const char* name_;
    std::optional<std::string> previous_;
};

void writeFile(const std::string& path, const GWData& bytes);
GWData readFile(const std::string& path);

// Runs a shell command; its exit status and standard output.
struct CommandResult {
    int status = -1;
    std::string output;
};
CommandResult runCommand(const std::string& command);
bool toolAvailable(const std::string& name);
std::string shellQuote(const std::string& text);

std::string hex(const GWData& bytes);
GWData bytesOf(const std::string& text);
// Deterministic pseudo-random bytes.
GWData randomBytes(std::size_t count, std::uint32_t seed);
// Text-like bytes: words and line breaks, compressible.
GWData textBytes(std::size_t count, std::uint32_t seed);

}  // namespace gwtest
