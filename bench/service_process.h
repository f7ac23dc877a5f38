// The service under measurement: started in the foreground (-debug) from
// its executable, watched for its CPU time and resident memory, and stopped
// as Ctrl+C stops it.
#pragma once

#include <cstdint>
#include <string>

namespace bench {

class ServiceProcess {
 public:
  ServiceProcess() = default;
  ServiceProcess(const ServiceProcess&) = delete;
  ServiceProcess& operator=(const ServiceProcess&) = delete;
  ~ServiceProcess() { Stop(); }

  // Starts `path -debug`; false when it could not be started.
  bool Start(const std::string& path);
  // Waits until the published block carries `statusWord` (up to `timeoutMs`).
  bool WaitForStatus(std::uint32_t statusWord, std::uint32_t timeoutMs) const;
  // User plus system CPU time used so far, in microseconds; -1 when unknown.
  double CpuMicros() const;
  // Resident memory now, in KiB; -1 when unknown.
  double ResidentKiB() const;
  void Stop();

 private:
  std::intptr_t id_ = 0;  // process handle on Windows, pid elsewhere
};

}  // namespace bench
