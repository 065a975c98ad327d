#include "CommandLine.h"

#include <algorithm>

namespace gwarchive {

std::optional<std::string> ParsedArguments::value(const std::string& name) const {
    auto found = options.find(name);
    if (found == options.end())
        return std::nullopt;
    return found->second;
}

std::vector<std::string> ParsedArguments::values(const std::string& name) const {
    std::vector<std::string> found;
    for (auto [at, end] = everyOption.equal_range(name); at != end; ++at)
        found.push_back(at->second);
    return found;
}

namespace {

const OptionDefinition* findLong(const std::vector<OptionDefinition>& definitions,
                                 const std::string& name) {
    auto found =
        std::find_if(definitions.begin(), definitions.end(),
                     [&](const OptionDefinition& option) { return name == option.longName; });
    return found == definitions.end() ? nullptr : &*found;
}

const OptionDefinition* findShort(const std::vector<OptionDefinition>& definitions, char name) {
    auto found =
        std::find_if(definitions.begin(), definitions.end(),
                     [&](const OptionDefinition& option) { return option.shortName == name; });
    return found == definitions.end() ? nullptr : &*found;
}

}  // namespace

std::optional<ParsedArguments> parseArguments(const std::vector<std::string>& words,
                                              const std::vector<OptionDefinition>& definitions,
                                              std::string* message) {
    ParsedArguments parsed;
    auto fail = [&](std::string text) -> std::optional<ParsedArguments> {
        if (message)
            *message = std::move(text);
        return std::nullopt;
    };
    auto set = [&parsed](const std::string& name, std::string value) {
        parsed.everyOption.emplace(name, value);
        parsed.options[name] = std::move(value);
    };
    for (std::size_t index = 0; index < words.size(); ++index) {
        const std::string& word = words[index];
        if (word == "--") {
            parsed.operands.insert(parsed.operands.end(), words.begin() + index + 1, words.end());
            break;
        }
        if (word.size() < 2 || word[0] != '-') {
            parsed.operands.push_back(word);
            continue;
        }
        if (word[1] == '-') {
            std::string name = word.substr(2);
            std::optional<std::string> inlineValue;
            if (auto equals = name.find('='); equals != std::string::npos) {
                inlineValue = name.substr(equals + 1);
                name.resize(equals);
            }
            const OptionDefinition* option = findLong(definitions, name);
            if (!option)
                return fail("unknown option '--" + name + "'");
            if (!option->takesValue) {
                if (inlineValue)
                    return fail("option '--" + name + "' takes no value");
                set(name, "");
            } else if (inlineValue) {
                set(name, *inlineValue);
            } else if (index + 1 < words.size()) {
                set(name, words[++index]);
            } else {
                return fail("option '--" + name + "' needs a value");
            }
            continue;
        }
        for (std::size_t position = 1; position < word.size(); ++position) {
            const OptionDefinition* option = findShort(definitions, word[position]);
            if (!option)
                return fail(std::string("unknown option '-") + word[position] + "'");
            if (!option->takesValue) {
                set(option->longName, "");
                continue;
            }
            if (position + 1 < word.size()) {
                set(option->longName, word.substr(position + 1));
            } else if (index + 1 < words.size()) {
                set(option->longName, words[++index]);
            } else {
                return fail(std::string("option '-") + word[position] + "' needs a value");
            }
            break;
        }
    }
    return parsed;
}

}  // namespace gwarchive
