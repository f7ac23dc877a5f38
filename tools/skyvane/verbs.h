// The client's verbs. Each Add* function adds its verbs to the command line;
// a verb's callback runs it and stores the process exit code in *exitCode:
// 0 done, 1 the service refused or failed, 2 bad input or no service to ask,
// 3 a wait timed out.
#pragma once

#include <CLI/CLI.hpp>

void AddStatusVerb(CLI::App& app, int* exitCode);
void AddPipeVerbs(CLI::App& app, int* exitCode);
void AddWatchVerb(CLI::App& app, int* exitCode);
// Host build only: the simulated machine's control verbs.
void AddSimVerbs(CLI::App& app, int* exitCode);
