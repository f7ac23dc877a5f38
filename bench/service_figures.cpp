// The figures of a running service: command round trips, idle CPU and
// resident memory.
#include <cstdio>

#include "figures.h"
#include "platform/win32.h"
#include "service_process.h"

namespace bench {

bool MeasureService(const Options& options, double floor, std::vector<Figure>& figures) {
  ServiceProcess service;
  if (!service.Start(options.service)) {
    std::fprintf(stderr, "cannot start %s\n", options.service.c_str());
    return false;
  }
  if (!service.WaitForStatus(102, 60000)) {
    std::fprintf(stderr, "the service did not become ready\n");
    return false;
  }
  if (!MeasureCommands(options, floor, figures)) {
    std::fprintf(stderr, "the service did not answer the commands\n");
    return false;
  }
  // Idle: nothing asks anything of the service; its monitor ticks on.
  const DWORD idleMs = options.quick ? 3000 : 60000;
  Sleep(1000);
  const double cpuBefore = service.CpuMicros();
  const double wallBefore = NowMicros();
  Sleep(idleMs);
  const double cpu = service.CpuMicros() - cpuBefore;
  const double wall = NowMicros() - wallBefore;
  figures.push_back({"idle CPU over " + std::to_string(idleMs / 1000) + " s", "% of a core",
                     100.0 * cpu / wall, "", 0});
  figures.push_back({"resident memory", "KiB", service.ResidentKiB(), "", 0});
  service.Stop();
  return true;
}

}  // namespace bench
