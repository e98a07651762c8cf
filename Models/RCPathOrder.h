// Path order: the order in which the orphan recovery run examines bare audio
// files, so that of several identical files the one with the shortest path
// stays. Shorter paths first (length in UTF-16 code units); paths of equal
// length compare case-sensitively with runs of digits compared by their
// numeric value ("Take 9" before "Take 10" by length, "Take 12" before
// "Take 13" by value). Pure functions; any thread.
#pragma once

#include <cstddef>
#include <string_view>

namespace quorvel {

// The length of UTF-8 `text` in UTF-16 code units (a character outside the
// Basic Multilingual Plane counts two; invalid bytes count one each).
std::size_t RCUTF16Length(std::string_view text);

// Case-sensitive comparison in which digit runs compare by numeric value;
// <0, 0 or >0. Runs of equal value with different leading zeros are equal.
int RCNumericCompare(std::string_view a, std::string_view b);

// Whether path `a` comes before path `b` in path order. A strict weak order
// (ties between paths that differ only in leading zeros are broken by their
// bytes), so it can sort.
bool RCPathOrderLess(std::string_view a, std::string_view b);

}  // namespace quorvel
