#include "platform/posix/namespace.h"

#include <dirent.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "platform/posix/kernel.h"

namespace emu {

void DestroyNamespace() {
  std::string name = kernel::NamespaceName();
  unlink(kernel::RegionPath());
  // Mapping storage files are "<namespace>.map.<slot>.<generation>".
  std::string prefix = name + ".";
  DIR* directory = opendir("/dev/shm");
  if (directory == nullptr) return;
  while (dirent* entry = readdir(directory)) {
    if (std::strncmp(entry->d_name, prefix.c_str(), prefix.size()) == 0) {
      unlinkat(dirfd(directory), entry->d_name, 0);
    }
  }
  closedir(directory);
}

}  // namespace emu
