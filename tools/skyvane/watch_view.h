// What `watch` shows of the state block: the status word in words, the
// drives with their letters, gauge bars and codes, the channels, and the
// last changes seen between two copies of the block.
#pragma once

#include <deque>
#include <nlohmann/json.hpp>
#include <string>

#include "monitor/state_block.h"

std::string StatusWordText(DWORD statusWord);
// "[###---]  50%" for a drive of 6 segments at 50 %; "no gauge" without segments.
std::string GaugeBar(DWORD segments, DWORD percent);

class WatchView {
 public:
  static constexpr std::size_t kEventsKept = 8;

  // Takes a new copy of the block: notes what changed since the last one
  // (stamped with `clock`, e.g. "18:40:02").
  void Update(const StateBlock& block, const std::string& clock);
  // The screen as lines of plain text.
  std::string Render(const StateBlock& block) const;
  nlohmann::ordered_json Json(const StateBlock& block) const;
  const std::deque<std::string>& Events() const { return events_; }

 private:
  void Note(const std::string& clock, const std::string& text);

  bool seen_ = false;
  DWORD statusWord_ = 0;
  LONG channelCount_ = 0;
  struct DriveView {
    std::string key;  // firmware serial, or the disk path for a record without one
    std::string name;
    std::string letters;
    DWORD gaugePercent = 0;
    DWORD statusCode = 0;
    DWORD powerState = 0;
  };
  std::deque<DriveView> drives_;
  std::deque<std::string> events_;  // newest first
};
