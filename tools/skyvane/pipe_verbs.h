// Verbs that talk to the service over its pipe: pause, resume, set-status,
// reg get, reg set, and a raw send for tests.
#pragma once

// Runs argv[1] as a pipe verb and returns the exit code: 0 when the service
// did what was asked, 1 when it refused or failed, 2 for a usage error
// (an unknown verb included).
int RunPipeVerb(int argc, char** argv);
