// Any bytes as a MAIL or RCPT argument (and its parameters), as a queue file and as the DATA
// stream. An address the server takes reads back the same from the queue
// file line built from it; the queue file reader stays inside its input and
// never hands out an address longer than a path may be; the message
// receiver stores the same text however the stream is split.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "mail/mailfile.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"

namespace {

using namespace velmor;

void check(bool ok) {
  if (!ok) std::abort();
}

void envelope_paths(std::string_view text) {
  for (bool recipient : {true, false}) {
    EnvelopePath path = parse_envelope_path(text, recipient ? "to" : "from", !recipient);
    // The parameters are a part of the argument behind the path.
    check(path.parameters.empty() || (path.parameters.data() >= text.data() &&
                                      path.parameters.data() + path.parameters.size() <= text.data() + text.size()));
    std::uint64_t size = 0;
    if (mail_size_parameter(path.parameters, size) != SizeParameter::given) check(size == 0);
    if (path.result != PathResult::ok) continue;
    std::string address(path.address);
    std::string file = "MAIL FROM:<a@b>\r\nRCPT TO:<" + address + ">\r\nDATA\r\nx\r\n.\r\n";
    if (!recipient) file = "MAIL FROM:<" + address + ">\r\nRCPT TO:<a@b>\r\nDATA\r\nx\r\n.\r\n";
    TextSource in(file);
    QueueEnvelope env = queue_read_envelope(in);
    check(!env.damaged && env.recipients.size() == 1);
    check((recipient ? env.recipients.front() : env.sender) == address);
  }
}

void queue_file(std::string_view text) {
  TextSource in(text);
  QueueEnvelope env = queue_read_envelope(in);
  check(env.data_offset <= env.body_offset && env.body_offset <= text.size());
  check(env.sender.size() <= kMaxAddress);
  for (const std::string& r : env.recipients) check(r.size() <= kMaxAddress);
}

// The stream fed whole, and in two pieces cut where the first byte says.
void data_stream(std::string_view text) {
  if (text.empty()) return;
  std::size_t cut = static_cast<unsigned char>(text.front()) % (text.size() + 1);
  MessageReceiver whole, split;
  whole.now = split.now = 1;
  std::string a, b;
  whole.feed(text, false, a);
  std::string pending(text.substr(0, cut));
  pending.erase(0, split.feed(pending, false, b));
  pending += text.substr(cut);
  split.feed(pending, false, b);
  check(a == b && whole.done() == split.done());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view text(reinterpret_cast<const char*>(data), size);
  envelope_paths(text);
  queue_file(text);
  data_stream(text);
  return 0;
}
