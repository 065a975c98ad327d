#pragma once

#include <cstddef>
#include <limits>
#include <string>
#include <vector>

#include "CommandLine.h"

namespace gwarchive {

// One subcommand: its options, how many operands it takes, its help text and
// what runs it. Every subcommand also takes -h/--help and -v/--verbose.
struct Command {
    const char* name;
    const char* summary;  // one line, for the tool's own help
    const char* help;     // the whole manual text of the subcommand
    std::vector<OptionDefinition> options;
    std::size_t minOperands;
    std::size_t maxOperands;
    int (*run)(const ParsedArguments& arguments);
};

constexpr std::size_t kAnyNumber = std::numeric_limits<std::size_t>::max();

extern const Command kListCommand;
extern const Command kExtractCommand;
extern const Command kCatCommand;
extern const Command kTestCommand;
extern const Command kInfoCommand;
extern const Command kDetectCommand;
extern const Command kMacBinaryCommand;
extern const Command kAppleDoubleCommand;

}  // namespace gwarchive
