// Any text as an overview file: the reader never throws or reads outside
// its input, and what it accepts it writes back in a form it reads again
// to the same records.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "core/globals.h"
#include "mail/mailbox.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  server_now = 1700000000;  // unset dates are written as "now": the same in both texts
  Mailbox box;
  if (mailbox_overview_parse(box, std::string_view(reinterpret_cast<const char*>(data), size)) != 0) return 0;
  std::string text = mailbox_overview_text(box);
  Mailbox again;
  if (mailbox_overview_parse(again, text) != 0 || mailbox_overview_text(again) != text) std::abort();
  return 0;
}
