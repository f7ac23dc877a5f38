// Small UTF-16 helpers over WCHAR, the same on every platform. Service code
// uses these instead of the C library's wide-character functions, whose
// wchar_t is 32 bits outside Windows. Substring and equality tests are
// case-sensitive, as device IDs and paths are compared.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/win32.h"

using WideView = std::basic_string_view<WCHAR>;
using WideString = std::basic_string<WCHAR>;

// Length up to the terminator, at most `capacity` units.
std::size_t WideLength(const WCHAR* text, std::size_t capacity = SIZE_MAX);
// Code unit by code unit equality up to the terminators.
bool WideEqual(const WCHAR* a, const WCHAR* b);
// Case-insensitive (ASCII letters only) equality.
bool WideEqualNoCase(const WCHAR* a, const WCHAR* b);
// True when `needle` occurs in `haystack` (an empty needle always occurs).
bool WideContains(const WCHAR* haystack, const WCHAR* needle);
// Copies up to the terminator into dest[capacity], always terminated; returns
// the units copied (the copy is cut when it does not fit).
std::size_t WideCopy(WCHAR* dest, std::size_t capacity, const WCHAR* source);
std::size_t WideCopy(WCHAR* dest, std::size_t capacity, WideView source);
// Appends to the terminated text in dest[capacity]; cut when it does not fit.
std::size_t WideAppend(WCHAR* dest, std::size_t capacity, WideView source);
// ASCII case mapping in place.
void WideToLower(WCHAR* text);
void WideToUpper(WCHAR* text);
// Removes white space (space, tab, CR, LF, VT, FF) at both ends, in place.
void WideTrim(WCHAR* text);
// Removes every occurrence of `pattern`, in place.
void WideRemoveAll(WCHAR* text, WideView pattern);
// Index just after the last occurrence of `ch`, or 0 when it does not occur.
std::size_t WideAfterLast(const WCHAR* text, WCHAR ch);

// Conversions for console output, files and test code.
std::string WideToUtf8(WideView text);
WideString Utf8ToWide(std::string_view text);

// Appends `value` in hexadecimal with at least `digits` digits (upper case),
// as "%0*X" would.
void WideAppendHex(WideString& out, std::uint64_t value, int digits, bool upper = true);
// Appends `value` in decimal, as "%d" would.
void WideAppendDecimal(WideString& out, std::int64_t value);
