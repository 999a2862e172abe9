// printf-style formatting into std::string, so that messages and protocol
// replies are built without fixed buffers.
#pragma once

#include <string>

namespace velmor {

std::string strprintf(const char* format, ...) __attribute__((format(printf, 1, 2)));
// Appends to `out`; returns `out`.
std::string& strappendf(std::string& out, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace velmor
