// The one argument parser of every tqovix command: short options alone, grouped or with
// their value attached (-q, -qv, -j2, -j 2), long ones with "=" or a separate value
// (--output=DIR, --output DIR), and "--" ending the options. -h/--help, -q/--quiet and -v
// are known to every command.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "Commands.h"

struct OptionSpec {
    std::string longName;  // without the dashes
    char shortName = 0;    // 0: long form only
    bool takesValue = false;
};

class CommandLine {
public:
    CommandLine(std::string command, std::string usage, std::vector<OptionSpec> options);

    // -1 when the command should run; otherwise the exit status to return at once: 0 after
    // printing the usage for -h, 2 after a usage error (said on stderr).
    int Parse(const Arguments& arguments);

    bool Has(const std::string& longName) const { return m_values.count(longName) != 0; }
    // The last value given, or `fallback`.
    std::string Value(const std::string& longName, const std::string& fallback = {}) const;
    const Arguments& Operands() const { return m_operands; }
    bool Quiet() const { return Has("quiet"); }
    bool Verbose() const { return Has("verbose"); }

    // A usage error: says `message` in one line on stderr, and gives the status 2.
    int Misuse(const std::string& message) const;
    // Whole number in [low, high] from option `longName`; false (after Misuse) otherwise.
    bool Number(const std::string& longName, long low, long high, long& value, int& status) const;

private:
    // The unknown `option` met in `word`, with the known one the word most likely meant.
    int Unknown(const std::string& word, const std::string& option) const;
    const OptionSpec* FindLong(const std::string& name) const;
    const OptionSpec* FindShort(char name) const;

    std::string m_command;
    std::string m_usage;
    std::vector<OptionSpec> m_options;
    std::map<std::string, std::string> m_values;
    Arguments m_operands;
};

// The one of `known` that `typed` most likely misspells (a unique prefix, or a few letters
// wrong); empty when none is close.
std::string ClosestName(const std::string& typed, const std::vector<std::string>& known);
