#include <fcntl.h>
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>

#include "Diagnostics.h"
#include "Locations.h"
#include "ToolArchive.h"
#include "foundation/GWHTTPRangeReader.h"

namespace gwarchive {

namespace {

// One line from the terminal with echo off; none when there is no terminal
// or nothing could be read.
std::optional<std::string> promptForPassword(const std::string& operand) {
    const int tty = ::open("/dev/tty", O_RDWR | O_NOCTTY | O_CLOEXEC);
    if (tty < 0)
        return std::nullopt;
    const std::string prompt = "Password for " + GWRedactedURLString(operand) + ": ";
    (void)!::write(tty, prompt.data(), prompt.size());
    termios saved{};
    const bool quiet = ::tcgetattr(tty, &saved) == 0;
    if (quiet) {
        termios silent = saved;
        silent.c_lflag &= ~tcflag_t(ECHO);
        ::tcsetattr(tty, TCSANOW, &silent);  // keeps what was typed ahead
    }
    std::string line;
    char c = 0;
    ssize_t got = 0;
    while ((got = ::read(tty, &c, 1)) == 1 && c != '\n')
        line += c;
    if (quiet)
        ::tcsetattr(tty, TCSANOW, &saved);
    (void)!::write(tty, "\n", 1);
    ::close(tty);
    if (got < 0 || (got == 0 && line.empty()))
        return std::nullopt;
    return line;
}

}  // namespace

bool usePasswordOptions(const ParsedArguments& arguments, ToolArchive& archive,
                        const std::string& operand, const std::vector<std::size_t>& entries) {
    if (auto password = arguments.value("password")) {
        archive.setPassword(*password);
        return true;
    }
    if (auto file = arguments.value("password-file")) {
        std::ifstream in(*file, std::ios::binary);
        std::string line;
        if (!in || (!std::getline(in, line) && !in.eof())) {
            reportError(*file, std::nullopt, GWPOSIXError(errno ? errno : EIO));
            return false;
        }
        archive.setPassword(line);
        return true;
    }
    if (::isatty(STDIN_FILENO) != 1)
        return true;
    for (std::size_t index : entries) {
        if (archive.entry(index).encrypted) {
            if (auto password = promptForPassword(operand))
                archive.setPassword(*password);
            return true;
        }
    }
    return true;
}

}  // namespace gwarchive
