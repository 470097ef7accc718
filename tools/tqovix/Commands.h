// The sub-commands of tqovix; each returns the process exit status.
#pragma once

#include <string>
#include <vector>

using Arguments = std::vector<std::string>;

int InspectCommand(const Arguments& arguments);
int MakeSampleCommand(const Arguments& arguments);
int CheckCommand(const Arguments& arguments);
int ProcessCommand(const Arguments& arguments);
int BatchCommand(const Arguments& arguments);
int CompareCommand(const Arguments& arguments);

// Removes the hidden partial files older than a day that killed jobs left in the directory
// `destination` is to be written in, saying so on stderr.
void RemoveStalePartials(const std::string& destination);
