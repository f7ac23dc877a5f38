// skyvane: a command-line client of the Skyvane service.
//   skyvane status [--json] [--wait-open] [--wait-status N] [--wait-sequence N] [--timeout-ms T]
// Verbs not in the table below go to the pipe verbs.
#include <cstdio>
#include <cstring>

#include "pipe_verbs.h"
#include "status_verb.h"

namespace {

struct VerbEntry {
  const char* name;
  int (*run)(int argc, char** argv);
};

constexpr VerbEntry kVerbs[] = {
    {"status", RunStatusVerb},
};

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) {
    std::fprintf(stderr,
                 "usage: skyvane status [--json] [--wait-open] [--wait-status N] "
                 "[--wait-sequence N] [--timeout-ms T]\n");
    return RunPipeVerb(argc, argv);  // adds the pipe verbs' usage lines
  }
  for (const VerbEntry& verb : kVerbs) {
    if (std::strcmp(argv[1], verb.name) == 0) return verb.run(argc, argv);
  }
  return RunPipeVerb(argc, argv);
}
