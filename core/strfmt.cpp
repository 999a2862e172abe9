#include "core/strfmt.h"

#include <cstdarg>
#include <cstdio>

namespace velmor {

namespace {
void vappend(std::string& out, const char* format, va_list args) {
  char small[256];
  va_list copy;
  va_copy(copy, args);
  int n = std::vsnprintf(small, sizeof small, format, copy);
  va_end(copy);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof small) {
    out.append(small, static_cast<size_t>(n));
    return;
  }
  size_t old = out.size();
  out.resize(old + static_cast<size_t>(n) + 1);
  std::vsnprintf(out.data() + old, static_cast<size_t>(n) + 1, format, args);
  out.resize(old + static_cast<size_t>(n));
}
}  // namespace

std::string strprintf(const char* format, ...) {
  std::string out;
  va_list args;
  va_start(args, format);
  vappend(out, format, args);
  va_end(args);
  return out;
}

std::string& strappendf(std::string& out, const char* format, ...) {
  va_list args;
  va_start(args, format);
  vappend(out, format, args);
  va_end(args);
  return out;
}

}  // namespace velmor
