// `skyvane status`: reads the shared state block as the user-interface
// application does and prints it.
#pragma once

int RunStatusVerb(int argc, char** argv);
