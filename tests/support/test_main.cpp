// The main() of every test program. On the host each process gets an emulation
// namespace and registry store of its own (a child inherits its parent's), so
// parallel test programs never see each other's objects.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <string>
#include <thread>

#include "child_process.h"
#include "platform/diagnostics.h"

#if !defined(_WIN32)
#include <unistd.h>

#include <filesystem>
#include <random>
#endif

namespace {

// After every case no handle or thread of this process may be live. A thread
// signals before it has quite unwound, so the counts are polled for a while.
class LeakCheck : public ::testing::EmptyTestEventListener {
 public:
  void OnTestEnd(const ::testing::TestInfo& /*info*/) override {
    long handles = platform::LiveHandleCount();
    long threads = platform::LiveThreadCount();
    if (handles < 0 || threads < 0) return;  // not known on this platform
    for (int poll = 0; poll < 2000 && (handles != 0 || threads != 0); ++poll) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
      handles = platform::LiveHandleCount();
      threads = platform::LiveThreadCount();
    }
    if (handles != 0 || threads != 0) {
      ADD_FAILURE() << "the case left " << handles << " live handle(s) and " << threads
                    << " live thread(s) in the emulation";
    }
  }
};

#if !defined(_WIN32)
std::filesystem::path g_registryDir;

bool IsSet(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr && *value != '\0';
}

// The registry store goes into a directory of its own, created by the
// emulation on the first write and removed at exit.
void Isolate() {
  std::random_device random;
  std::string tag = std::to_string(getpid()) + "-" + std::to_string(random() % 1000000);
  if (!IsSet("SKYVANE_NAMESPACE")) setenv("SKYVANE_NAMESPACE", ("t" + tag).c_str(), 1);
  if (IsSet("SKYVANE_REGISTRY")) return;
  do {
    g_registryDir = std::filesystem::temp_directory_path() /
                    ("skyvane-test-" + tag + "-" + std::to_string(random() % 1000));
  } while (std::filesystem::exists(g_registryDir));
  setenv("SKYVANE_REGISTRY", (g_registryDir / "registry").c_str(), 1);
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(g_registryDir, ignored);
  });
}
#endif

}  // namespace

int main(int argc, char** argv) {
#if !defined(_WIN32)
  Isolate();
#endif
  ::testing::InitGoogleTest(&argc, argv);
  ::testing::UnitTest::GetInstance()->listeners().Append(new LeakCheck);
  int result = RUN_ALL_TESTS();
  // A child must have run exactly its one case and passed it.
  if (skytest::ChildRole() != nullptr && result == 0 &&
      ::testing::UnitTest::GetInstance()->successful_test_count() != 1) {
    result = 3;
  }
  return result;
}
