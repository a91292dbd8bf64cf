// tarvodctl's rule commands: check (the configuration and rules as the daemon loads them) and
// test (one event through the engine in dry-run mode). Each takes the words after its name
// and returns the exit status.
#pragma once

#include <string>
#include <vector>

int RunCheck(const std::vector<std::string>& args, const std::string& configurationPath);
int RunTest(const std::vector<std::string>& args, const std::string& configurationPath);
