#include "CommandLine.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace {

// Edits (insert, delete, replace, swap two neighbours) from `a` to `b`.
size_t Distance(const std::string& a, const std::string& b)
{
    std::vector<std::vector<size_t>> d(a.size() + 1, std::vector<size_t>(b.size() + 1));
    for (size_t i = 0; i <= a.size(); ++i) {
        for (size_t j = 0; j <= b.size(); ++j) {
            if (i == 0 || j == 0) {
                d[i][j] = i + j;
                continue;
            }
            d[i][j] = std::min({d[i - 1][j] + 1, d[i][j - 1] + 1, d[i - 1][j - 1] + (a[i - 1] != b[j - 1])});
            if (i > 1 && j > 1 && a[i - 1] == b[j - 2] && a[i - 2] == b[j - 1]) {
                d[i][j] = std::min(d[i][j], d[i - 2][j - 2] + 1);
            }
        }
    }
    return d[a.size()][b.size()];
}

}  // namespace

std::string ClosestName(const std::string& typed, const std::vector<std::string>& known)
{
    // Names people type are short; a long word is no option misspelt.
    if (typed.empty() || typed.size() > 64) {
        return {};
    }
    std::string prefixed;
    size_t prefixes = 0;
    for (const std::string& name : known) {
        if (name.starts_with(typed)) {
            prefixed = name;
            ++prefixes;
        }
    }
    if (prefixes == 1) {
        return prefixed;
    }
    std::string best;
    size_t bestDistance = SIZE_MAX;
    for (const std::string& name : known) {
        const size_t distance = Distance(typed, name);
        // A third of the letters wrong at most: "jsn" is "json", "z" is not "f".
        if (distance * 3 <= std::max(typed.size(), name.size()) && distance < bestDistance) {
            best = name;
            bestDistance = distance;
        }
    }
    return best;
}

CommandLine::CommandLine(std::string command, std::string usage, std::vector<OptionSpec> options)
    : m_command(std::move(command)), m_usage(std::move(usage)), m_options(std::move(options))
{
    m_options.push_back({"help", 'h', false});
    m_options.push_back({"quiet", 'q', false});
    m_options.push_back({"verbose", 'v', false});
}

const OptionSpec* CommandLine::FindLong(const std::string& name) const
{
    for (const OptionSpec& option : m_options) {
        if (option.longName == name) {
            return &option;
        }
    }
    return nullptr;
}

const OptionSpec* CommandLine::FindShort(char name) const
{
    for (const OptionSpec& option : m_options) {
        if (option.shortName != 0 && option.shortName == name) {
            return &option;
        }
    }
    return nullptr;
}

int CommandLine::Misuse(const std::string& message) const
{
    std::fprintf(stderr, "tqovix %s: %s (tqovix %s -h lists its options)\n", m_command.c_str(), message.c_str(),
                 m_command.c_str());
    return 2;
}

int CommandLine::Unknown(const std::string& word, const std::string& option) const
{
    std::vector<std::string> names;
    for (const OptionSpec& known : m_options) {
        names.push_back(known.longName);
    }
    // A word of short options ("-json": -j -s -o -n) was more likely a long option with one dash.
    const std::string meant = word.size() > 2 ? ClosestName(word.substr(word.starts_with("--") ? 2 : 1), names) : "";
    if (!meant.empty()) {
        return Misuse("unknown option '" + word + "'; did you mean '--" + meant + "'?");
    }
    return Misuse("unknown option '" + option + "'");
}

int CommandLine::Parse(const Arguments& arguments)
{
    bool optionsEnded = false;
    for (size_t i = 0; i < arguments.size(); ++i) {
        const std::string& argument = arguments[i];
        if (optionsEnded || argument == "-" || !argument.starts_with("-")) {
            m_operands.push_back(argument);
            continue;
        }
        if (argument == "--") {
            optionsEnded = true;
            continue;
        }
        if (argument.starts_with("--")) {
            const size_t equals = argument.find('=');
            const std::string name = argument.substr(2, equals == std::string::npos ? std::string::npos : equals - 2);
            const OptionSpec* option = FindLong(name);
            if (option == nullptr) {
                return Unknown("--" + name, "--" + name);
            }
            if (!option->takesValue && equals != std::string::npos) {
                return Misuse("'--" + name + "' takes no value");
            }
            if (option->takesValue && equals == std::string::npos && i + 1 >= arguments.size()) {
                return Misuse("'--" + name + "' needs a value");
            }
            m_values[name] = !option->takesValue            ? std::string()
                             : equals != std::string::npos ? argument.substr(equals + 1)
                                                           : arguments[++i];
            continue;
        }
        // Short options, grouped; one that takes a value takes the rest of the word or the next.
        for (size_t at = 1; at < argument.size(); ++at) {
            const OptionSpec* option = FindShort(argument[at]);
            if (option == nullptr) {
                return Unknown(argument, std::string("-") + argument[at]);
            }
            if (!option->takesValue) {
                m_values[option->longName].clear();
                continue;
            }
            if (at + 1 < argument.size()) {
                m_values[option->longName] = argument.substr(at + 1);
            } else if (i + 1 < arguments.size()) {
                m_values[option->longName] = arguments[++i];
            } else {
                return Misuse(std::string("'-") + argument[at] + "' needs a value");
            }
            break;
        }
    }
    if (Has("help")) {
        std::fputs(m_usage.c_str(), stdout);
        return 0;
    }
    return -1;
}

std::string CommandLine::Value(const std::string& longName, const std::string& fallback) const
{
    const auto found = m_values.find(longName);
    return found == m_values.end() ? fallback : found->second;
}

bool CommandLine::Number(const std::string& longName, long low, long high, long& value, int& status) const
{
    if (!Has(longName)) {
        return true;
    }
    const std::string text = Value(longName);
    char* end = nullptr;
    const long parsed = std::strtol(text.c_str(), &end, 10);
    if (text.empty() || *end != '\0' || parsed < low || parsed > high) {
        status = Misuse("--" + longName + " takes a whole number from " + std::to_string(low) + " to " +
                        std::to_string(high));
        return false;
    }
    value = parsed;
    return true;
}
