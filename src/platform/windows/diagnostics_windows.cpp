#include "platform/diagnostics.h"

namespace platform {

long LiveHandleCount() {
  return -1;
}
long LiveThreadCount() {
  return -1;
}
double TimeScale() {
  return 1.0;
}

}  // namespace platform
