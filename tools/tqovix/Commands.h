// The sub-commands of tqovix; each returns the process exit status.
#pragma once

#include <string>
#include <vector>

using Arguments = std::vector<std::string>;

int InspectCommand(Arguments arguments);
int MakeSampleCommand(const Arguments& arguments);
int CheckCommand(const Arguments& arguments);
int ProcessCommand(const Arguments& arguments);
int BatchCommand(const Arguments& arguments);
int CompareCommand(Arguments arguments);

// A sentence for an internal result code, for people reading a terminal.
std::string DescribeInternalCode(int code);
// The same for a code the exported functions answer with (0, 7, 8, 9, 20, 100 ... 200).
std::string DescribeResult(int code);
// Removes the hidden partial files older than a day that killed jobs left in the directory
// `destination` is to be written in, saying so on stderr.
void RemoveStalePartials(const std::string& destination);
// `text` as a JSON string, quotes included.
std::string JsonString(const std::string& text);
