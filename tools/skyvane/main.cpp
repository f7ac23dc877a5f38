// skyvane: a command-line client of the Skyvane service. `skyvane --help`
// lists the verbs, `skyvane VERB --help` describes one.
#include <cstdio>
#include <string>

#include "verbs.h"

int main(int argc, char** argv) {
  CLI::App app("skyvane: a client of the Skyvane service", "skyvane");
  app.require_subcommand(1);
  int exitCode = 0;
  AddStatusVerb(app, &exitCode);
  AddPipeVerbs(app, &exitCode);
  AddWatchVerb(app, &exitCode);
#ifdef SKYVANE_SIM_VERBS
  AddSimVerbs(app, &exitCode);
#endif
  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp&) {
    std::printf("%s", app.help().c_str());
    return 0;
  } catch (const CLI::ParseError& e) {
    if (e.get_exit_code() == 0) return app.exit(e);  // --help of a verb
    // One line on standard error, naming the verb; its --help has the rest.
    std::string verb;
    for (const CLI::App* sub = &app; !sub->get_subcommands().empty();) {
      sub = sub->get_subcommands().front();
      verb += " " + sub->get_name();
    }
    if (verb.empty() && argc > 1 && argv[1][0] != '-') {
      std::fprintf(stderr, "skyvane: unknown verb %s (see --help)\n", argv[1]);
    } else {
      std::fprintf(stderr, "skyvane%s: %s (see --help)\n", verb.c_str(), e.what());
    }
    return 2;
  }
  std::fflush(stdout);
  return exitCode;
}
