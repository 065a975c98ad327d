#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace gwarchive {

struct OptionDefinition {
    char shortName;        // 0 when the option has no short form
    const char* longName;  // without the leading "--"
    bool takesValue;
};

// The words of one subcommand once parsed: options under their long names
// (a flag maps to ""), then the operands in order.
struct ParsedArguments {
    std::map<std::string, std::string> options;
    std::multimap<std::string, std::string> everyOption;  // repeats included, in order
    std::vector<std::string> operands;

    bool has(const std::string& name) const { return options.count(name) != 0; }
    std::optional<std::string> value(const std::string& name) const;
    // Every value an option that may be repeated was given, in order.
    std::vector<std::string> values(const std::string& name) const;
};

// Getopt-style parsing: "-l", grouped "-lv", "-C DIR", "-CDIR", "--long",
// "--dir=DIR", "--dir DIR"; "--" ends the options and a lone "-" is an
// operand. A later option of the same name replaces an earlier one. On a
// usage error returns none and says why in `message`.
std::optional<ParsedArguments> parseArguments(const std::vector<std::string>& words,
                                              const std::vector<OptionDefinition>& definitions,
                                              std::string* message);

}  // namespace gwarchive
