// skyvane_bench [--quick] [--json FILE] [--service PATH]: measures the
// figures and prints them as a table, and as JSON to FILE when asked. With
// --service it starts that executable in the foreground and measures it too;
// it must be the only service of its emulation namespace (or of the machine).
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "figures.h"

namespace {

void PrintTable(const std::vector<bench::Figure>& figures) {
  std::printf("| figure | value | unit | ratio to floor |\n|---|---:|---|---|\n");
  for (const bench::Figure& f : figures) {
    std::string ratio = f.floorName.empty() ? "" : std::to_string(f.ratio) + " x " + f.floorName;
    std::printf("| %s | %.1f | %s | %s |\n", f.name.c_str(), f.value, f.unit.c_str(), ratio.c_str());
  }
}

bool WriteJson(const char* path, const std::vector<bench::Figure>& figures) {
  FILE* out = std::fopen(path, "w");
  if (out == nullptr) return false;
  std::fprintf(out, "{\n  \"figures\": [\n");
  for (std::size_t i = 0; i < figures.size(); ++i) {
    const bench::Figure& f = figures[i];
    std::fprintf(out, "    {\"name\": \"%s\", \"unit\": \"%s\", \"value\": %.3f", f.name.c_str(),
                 f.unit.c_str(), f.value);
    if (!f.floorName.empty()) {
      std::fprintf(out, ", \"floor\": \"%s\", \"ratio\": %.3f", f.floorName.c_str(), f.ratio);
    }
    std::fprintf(out, "}%s\n", i + 1 < figures.size() ? "," : "");
  }
  std::fprintf(out, "  ]\n}\n");
  return std::fclose(out) == 0;
}

}  // namespace

int main(int argc, char** argv) {
#if defined(SKYVANE_BENCH_RESCAN)
  if (argc == 2 && std::strcmp(argv[1], "--rescan-child") == 0) return bench::RunRescanChild(false);
  if (argc == 2 && std::strcmp(argv[1], "--rescan-child-quick") == 0) {
    return bench::RunRescanChild(true);
  }
#endif
  bench::Options options;
  const char* json = nullptr;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--quick") == 0) {
      options.quick = true;
    } else if (std::strcmp(argv[i], "--json") == 0 && i + 1 < argc) {
      json = argv[++i];
    } else if (std::strcmp(argv[i], "--service") == 0 && i + 1 < argc) {
      options.service = argv[++i];
    } else {
      std::fprintf(stderr, "usage: skyvane_bench [--quick] [--json FILE] [--service PATH]\n");
      return 2;
    }
  }
  std::vector<bench::Figure> figures;
  const double floor = bench::MeasureFloor(options, figures);
  bench::MeasureWakeLatency(options, figures);
  bench::MeasurePublish(options, floor, figures);
#if defined(SKYVANE_BENCH_RESCAN)
  bench::MeasureRescan(options, argv[0], figures);
#endif
  bool ok = options.service.empty() || bench::MeasureService(options, floor, figures);
  PrintTable(figures);
  if (json != nullptr && !WriteJson(json, figures)) {
    std::fprintf(stderr, "cannot write %s\n", json);
    return 1;
  }
  return ok ? 0 : 1;
}
