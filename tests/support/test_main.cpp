// The main() of every test program. On the host it first gives the process an
// emulation namespace and registry store of its own (unless the environment
// already names them, as for a child started by RunChildSelf), so parallel
// test programs never see each other's named objects, pipes or registry; it
// removes the registry at exit (the namespace ends with its last process). Every case is checked for leaked handles and threads.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "child_process.h"
#include "leak_check.h"

#if !defined(_WIN32)
#include <unistd.h>

#include <filesystem>
#include <random>
#endif

namespace {

#if !defined(_WIN32)
struct Isolation {
  std::filesystem::path registryDir;
};

bool IsSet(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr && *value != '\0';
}

// The registry store goes into a directory of its own that is only named
// here: the emulation creates it on the first registry write, so a program
// that never touches the registry (or ends abnormally before) leaves nothing.
void Isolate(Isolation& isolation) {
  std::random_device random;
  std::string tag = std::to_string(getpid()) + "-" + std::to_string(random() % 1000000);
  if (!IsSet("SKYVANE_NAMESPACE")) {
    setenv("SKYVANE_NAMESPACE", ("t" + tag).c_str(), 1);
  }
  if (!IsSet("SKYVANE_REGISTRY")) {
    std::filesystem::path directory;
    do {
      directory =
          std::filesystem::temp_directory_path() /
          ("skyvane-test-" + std::to_string(getpid()) + "-" + std::to_string(random() % 1000000));
    } while (std::filesystem::exists(directory));
    isolation.registryDir = directory;
    setenv("SKYVANE_REGISTRY", (directory / "registry").c_str(), 1);
  }
}

Isolation g_isolation;

// Runs at exit, also when a case ends the process through exit().
void Release() {
  const Isolation& isolation = g_isolation;
  if (!isolation.registryDir.empty()) {
    std::error_code ignored;
    std::filesystem::remove_all(isolation.registryDir, ignored);
  }
}
#endif

}  // namespace

int main(int argc, char** argv) {
#if !defined(_WIN32)
  Isolate(g_isolation);
  std::atexit(Release);
#endif
  ::testing::InitGoogleTest(&argc, argv);
  skytest::InstallLeakCheck();
  int result = RUN_ALL_TESTS();
  // A child must have run exactly its one case, and passed it; a filter that
  // matched nothing must not count as success.
  if (skytest::ChildRole() != nullptr && result == 0 &&
      ::testing::UnitTest::GetInstance()->successful_test_count() != 1) {
    result = 3;
  }
  return result;
}
