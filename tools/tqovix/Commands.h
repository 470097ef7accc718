// The sub-commands of tqovix; each returns the process exit status.
#pragma once

#include <string>
#include <vector>

using Arguments = std::vector<std::string>;

int InspectCommand(const Arguments& arguments);
int MakeSampleCommand(const Arguments& arguments);

// A sentence for an internal result code, for people reading a terminal.
std::string DescribeInternalCode(int code);
