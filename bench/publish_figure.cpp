// The time of one forced publish: the sequence increment and the copy of the
// block into the mapping through the view the service keeps, under the
// mutex, as every valid pipe request ends with.
#include <vector>

#include "../tests/unit_monitor/monitor_setup.h"
#include "figures.h"

namespace bench {

void MeasurePublish(const Options& options, double floor, std::vector<Figure>& figures) {
  if (!OpenMonitorState()) {
    CloseMonitorState();
    return;
  }
  const int rounds = options.quick ? 200 : 5000;
  std::vector<double> samples;
  for (int i = 0; i < rounds + 20; ++i) {
    const double start = NowMicros();
    PublishStateBlock(nullptr, true);
    if (i >= 20) samples.push_back(NowMicros() - start);
  }
  CloseMonitorState();
  const double p50 = Percentile(samples, 50);
  figures.push_back({"publish (forced), p50", "us", p50, "floor p50", floor > 0 ? p50 / floor : 0});
}

}  // namespace bench
