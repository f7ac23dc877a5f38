// The maker's model knowledge: the model table (model-number suffix to flags,
// capacity-gauge size and product-line name) and the two lists of product
// identifiers that present a control channel.
#pragma once

#include <cstddef>

#include "platform/win32.h"

// One row of the model table; a drive record holds a copy (offsets 48-71).
struct ModelRow {
  const WCHAR* suffix;
  DWORD flags;               // only bit 0x10 (kModelFlagExtendedIdentity) is consulted
  DWORD gaugeSegments;       // 0, 4 or 6
  const WCHAR* productLine;  // null when the row has none
};

static_assert(sizeof(ModelRow) == 24);
static_assert(offsetof(ModelRow, flags) == 8);
static_assert(offsetof(ModelRow, gaugeSegments) == 12);
static_assert(offsetof(ModelRow, productLine) == 16);

constexpr DWORD kModelFlagExtendedIdentity = 0x10;
constexpr int kModelRowCount = 19;

// The rows in table order, followed by the end row (empty suffix).
extern const ModelRow kModelTable[kModelRowCount + 1];

// First row whose suffix matches: a text shorter than 5 units is a bare model
// code and matches a suffix that contains it; a longer text (an instance ID
// or path) matches a suffix it contains. Case-sensitive. row is written only
// on a match.
bool LookupModelRow(const WCHAR* text, ModelRow* row);
// True when text contains an entry of the channel-model list.
bool IsChannelModel(const WCHAR* text);
// True when text contains an entry of the standalone-channel list.
bool IsStandaloneChannelModel(const WCHAR* text);
// Copies 8-bit text, one byte per unit widened with its sign, while fewer than
// capacity - 1 and fewer than maxChars units are written and the byte is not
// 0. dest is always terminated (when capacity > 0); returns the units copied.
DWORD CopyAsciiToWide(WCHAR* dest, DWORD capacity, const BYTE* source, DWORD maxChars);

// True when `key` (not empty) is a whole component of `text`: a run between
// the separators of device IDs and interface paths ('\\', '#', '&') or the
// text's ends. Keys of drives are compared so, never as bare substrings, so
// that a short key cannot match inside another drive's ID.
bool ContainsComponent(const WCHAR* text, const WCHAR* key);
