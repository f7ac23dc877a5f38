#include "watch_view.h"

#include <cstdarg>
#include <cstdio>

#include "block_reader.h"

namespace {

std::string Letters(const DriveRecord& d) {
  std::string out;
  for (const char c : FIELD_TEXT(d, volumeLetters)) {
    if (!out.empty()) out += ' ';
    out += c;
    out += ':';
  }
  return out.empty() ? "-" : out;
}

std::string DriveName(const DriveRecord& d) {
  std::string model = FIELD_TEXT(d, model);
  std::string serial = FIELD_TEXT(d, firmwareSerial);
  if (model.empty()) model = FIELD_TEXT(d, friendlyName);
  return serial.empty() ? model : model + " (" + serial + ")";
}

const char* KindText(DWORD kind) {
  switch (kind) {
    case kChannelKindHid:
      return "hid";
    case kChannelKindDriver:
      return "driver";
    case kChannelKindVendorControl:
      return "vendor";
    default:
      return "other";
  }
}

const char* ModeText(DWORD mode) {
  switch (mode) {
    case kChannelModePlain:
      return "plain";
    case kChannelModeGauge:
      return "gauge";
    case kChannelModeEnclosure:
      return "enclosure";
    default:
      return "other";
  }
}

std::string Shorten(std::string text, std::size_t width) {
  if (text.size() > width) text = text.substr(0, width - 3) + "...";
  return text;
}

std::string Format(const char* format, ...) __attribute__((format(printf, 1, 2)));
std::string Format(const char* format, ...) {
  char line[512];
  va_list args;
  va_start(args, format);
  std::vsnprintf(line, sizeof(line), format, args);
  va_end(args);
  return line;
}

}  // namespace

std::string StatusWordText(DWORD statusWord) {
  switch (statusWord) {
    case 0:
      return "starting";
    case kStatusUncountedDrive:
      return "a drive is not of a channel model";
    case kStatusRescanStarting:
      return "rescan";
    case kStatusRescanDone:
      return "ready";
    case kStatusStopping:
      return "stopped";
    default:
      break;
  }
  if (statusWord >= kStatusRemovalFailedBase && statusWord < kStatusRemovalFailedBase + 64) {
    return "removal of drive " + std::to_string(statusWord - kStatusRemovalFailedBase) + " failed";
  }
  return "set to " + std::to_string(statusWord);
}

std::string GaugeBar(DWORD segments, DWORD percent) {
  if (segments == 0) return "no gauge";
  DWORD lit = (percent * segments + 50) / 100;
  if (lit > segments) lit = segments;
  return "[" + std::string(lit, '#') + std::string(segments - lit, '-') + "] " +
         Format("%3u%%", static_cast<unsigned>(percent));
}

void WatchView::Note(const std::string& clock, const std::string& text) {
  events_.push_front(clock + "  " + text);
  if (events_.size() > kEventsKept) events_.pop_back();
}

void WatchView::Update(const StateBlock& block, const std::string& clock) {
  std::deque<DriveView> now;
  for (int i = 0; i < Clamp(block.driveCount, kMaxDrives); ++i) {
    const DriveRecord& d = block.drives[i];
    DriveView view;
    view.key = FIELD_TEXT(d, firmwareSerial);
    if (view.key.empty()) view.key = FIELD_TEXT(d, diskPath);
    view.name = DriveName(d);
    view.letters = Letters(d);
    view.gaugePercent = d.gaugePercent;
    view.statusCode = d.statusCode;
    view.powerState = d.powerState;
    now.push_back(view);
  }
  if (seen_) {
    if (block.statusWord != statusWord_) {
      Note(clock, "status word " + std::to_string(block.statusWord) + ": " +
                      StatusWordText(block.statusWord));
    }
    for (const DriveView& before : drives_) {
      const DriveView* after = nullptr;
      for (const DriveView& d : now) {
        if (d.key == before.key) after = &d;
      }
      if (after == nullptr) {
        Note(clock, before.name + " went away (" + before.letters + ")");
        continue;
      }
      if (after->letters != before.letters) {
        Note(clock, before.name + ": letters " + before.letters + " -> " + after->letters);
      }
      // A record rebuilt by an enumeration has no gauge value yet (0) until
      // the next refresh: only values computed are worth a line.
      if (after->gaugePercent != before.gaugePercent && after->gaugePercent != 0) {
        Note(clock, Format("%s: gauge %u%%", before.name.c_str(),
                           static_cast<unsigned>(after->gaugePercent)));
      }
      if (after->statusCode != before.statusCode) {
        Note(clock, Format("%s: status code %u -> %u", before.name.c_str(),
                           static_cast<unsigned>(before.statusCode),
                           static_cast<unsigned>(after->statusCode)));
      }
      if (after->powerState != before.powerState) {
        Note(clock, Format("%s: sleep %u -> %u", before.name.c_str(),
                           static_cast<unsigned>(before.powerState),
                           static_cast<unsigned>(after->powerState)));
      }
    }
    for (const DriveView& d : now) {
      bool known = false;
      for (const DriveView& before : drives_) known = known || before.key == d.key;
      if (!known) Note(clock, d.name + " arrived (" + d.letters + ")");
    }
    if (block.channelCount != channelCount_) {
      Note(clock, Format("channels %d -> %d", static_cast<int>(channelCount_),
                         static_cast<int>(block.channelCount)));
    }
  }
  seen_ = true;
  statusWord_ = block.statusWord;
  channelCount_ = block.channelCount;
  drives_ = std::move(now);
}

std::string WatchView::Render(const StateBlock& block) const {
  std::string out =
      Format("Skyvane Service   sequence %u   status word %u: %s\n\n",
             static_cast<unsigned>(block.sequence), static_cast<unsigned>(block.statusWord),
             StatusWordText(block.statusWord).c_str());
  const int drives = Clamp(block.driveCount, kMaxDrives);
  out += Format("Drives (%d, %d published)\n", drives, static_cast<int>(block.publishedCount));
  out += Format("  %-2s %-8s %-32s %-16s %-6s %-5s %-5s\n", "#", "letters", "drive", "gauge",
                "status", "level", "sleep");
  for (int i = 0; i < drives; ++i) {
    const DriveRecord& d = block.drives[i];
    out +=
        Format("  %-2d %-8s %-32s %-16s %-6u %-5d %-5u\n", i, Letters(d).c_str(),
               Shorten(DriveName(d), 32).c_str(), GaugeBar(d.gaugeSegments, d.gaugePercent).c_str(),
               static_cast<unsigned>(d.statusCode), static_cast<int>(d.statusLevel),
               static_cast<unsigned>(d.powerState));
  }
  const int channels = Clamp(block.channelCount, kMaxChannels);
  out += Format("\nChannels (%d)\n  %-2s %-6s %-9s %-5s %-5s %s\n", channels, "#", "kind", "mode",
                "drive", "sent", "device path");
  for (int i = 0; i < channels; ++i) {
    const ChannelRecord& c = block.channels[i];
    const std::string linked = c.linkedDrive < 0 ? "-" : std::to_string(c.linkedDrive);
    const std::string sent =
        c.gaugePercentSent == 0 ? "-" : std::to_string(c.gaugePercentSent) + "%";
    out += Format("  %-2d %-6s %-9s %-5s %-5s %s\n", i, KindText(c.kind), ModeText(c.mode),
                  linked.c_str(), sent.c_str(), Shorten(FIELD_TEXT(c, devicePath), 48).c_str());
  }
  out += "\nLast changes\n";
  if (events_.empty()) out += "  (none yet)\n";
  for (const std::string& event : events_) out += "  " + event + "\n";
  return out;
}

nlohmann::ordered_json WatchView::Json(const StateBlock& block) const {
  nlohmann::ordered_json out = {{"sequence", block.sequence},
                                {"statusWord", block.statusWord},
                                {"status", StatusWordText(block.statusWord)},
                                {"publishedCount", block.publishedCount}};
  auto& drives = out["drives"] = nlohmann::ordered_json::array();
  for (int i = 0; i < Clamp(block.driveCount, kMaxDrives); ++i) {
    auto drive = DriveJson(block.drives[i], i);
    drive["gauge"] = GaugeBar(block.drives[i].gaugeSegments, block.drives[i].gaugePercent);
    drives.push_back(drive);
  }
  auto& channels = out["channels"] = nlohmann::ordered_json::array();
  for (int i = 0; i < Clamp(block.channelCount, kMaxChannels); ++i) {
    channels.push_back(ChannelJson(block.channels[i], i));
  }
  out["events"] = events_;
  return out;
}
