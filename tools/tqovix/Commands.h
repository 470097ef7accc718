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
// A hidden name of that form beside `destination`, created empty so that it is ours; when it
// cannot be created, the name anyway (a job on it then fails as one on `destination` would).
std::string ReservePartial(const std::string& destination);
// Gives `partial` the name `destination` only if that name is free: 0, or the errno (EEXIST
// when taken).
int PublishWithoutReplacing(const std::string& partial, const std::string& destination);
