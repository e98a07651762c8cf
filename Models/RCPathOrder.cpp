#include "Models/RCPathOrder.h"

namespace quorvel {
namespace {

bool isDigit(char c) { return c >= '0' && c <= '9'; }

// The digit run starting at `at`, without its leading zeros.
std::string_view digitRun(std::string_view text, std::size_t& at) {
  const std::size_t start = at;
  while (at < text.size() && isDigit(text[at])) ++at;
  std::string_view run = text.substr(start, at - start);
  while (run.size() > 1 && run.front() == '0') run.remove_prefix(1);
  return run;
}

}  // namespace

std::size_t RCUTF16Length(std::string_view text) {
  std::size_t units = 0;
  for (unsigned char c : text) {
    if ((c & 0xC0) == 0x80) continue;  // continuation byte
    units += c >= 0xF0 && c <= 0xF4 ? 2 : 1;
  }
  return units;
}

int RCNumericCompare(std::string_view a, std::string_view b) {
  std::size_t i = 0;
  std::size_t j = 0;
  while (i < a.size() && j < b.size()) {
    if (isDigit(a[i]) && isDigit(b[j])) {
      std::string_view x = digitRun(a, i);
      std::string_view y = digitRun(b, j);
      if (x.size() != y.size()) return x.size() < y.size() ? -1 : 1;
      if (int order = x.compare(y); order != 0) return order < 0 ? -1 : 1;
      continue;
    }
    // Bytes of UTF-8 compare in the order of their code points.
    const auto x = static_cast<unsigned char>(a[i++]);
    const auto y = static_cast<unsigned char>(b[j++]);
    if (x != y) return x < y ? -1 : 1;
  }
  if (i < a.size()) return 1;
  if (j < b.size()) return -1;
  return 0;
}

bool RCPathOrderLess(std::string_view a, std::string_view b) {
  const std::size_t lengthA = RCUTF16Length(a);
  const std::size_t lengthB = RCUTF16Length(b);
  if (lengthA != lengthB) return lengthA < lengthB;
  if (int order = RCNumericCompare(a, b); order != 0) return order < 0;
  return a < b;
}

}  // namespace quorvel
