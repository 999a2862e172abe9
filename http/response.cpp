#include "http/response.h"

#include "core/strfmt.h"

namespace velmor::http {

std::string_view reason_phrase(int status) {
  static const std::pair<int, std::string_view> phrases[] = {
      {100, "Continue"},
      {101, "Switching Protocols"},
      {200, "OK"},
      {201, "Created"},
      {202, "Accepted"},
      {204, "No Content"},
      {206, "Partial Content"},
      {301, "Moved Permanently"},
      {302, "Found"},
      {303, "See Other"},
      {304, "Not Modified"},
      {307, "Temporary Redirect"},
      {308, "Permanent Redirect"},
      {400, "Bad Request"},
      {401, "Unauthorized"},
      {403, "Forbidden"},
      {404, "Not Found"},
      {405, "Method Not Allowed"},
      {407, "Proxy Authentication Required"},
      {408, "Request Timeout"},
      {411, "Length Required"},
      {413, "Content Too Large"},
      {414, "URI Too Long"},
      {431, "Request Header Fields Too Large"},
      {500, "Internal Server Error"},
      {501, "Not Implemented"},
      {502, "Bad Gateway"},
      {503, "Service Unavailable"},
      {504, "Gateway Timeout"},
      {505, "HTTP Version Not Supported"},
  };
  for (const auto& [code, phrase] : phrases) {
    if (code == status) return phrase;
  }
  return "Unknown";
}

std::string status_line(int status, std::string_view reason, int version) {
  if (reason.empty()) reason = reason_phrase(status);
  return strprintf("HTTP/%d.%d %03d ", version / 10, version % 10, status) + without_controls(reason) + "\r\n";
}

std::string write_head(const ResponseHead& response) {
  if (response.version < 10) return {};
  return status_line(response.status, response.reason, response.version) + response.headers.text() + "\r\n";
}

}  // namespace velmor::http
