#include "http/chunked.h"

#include <algorithm>

#include "core/strfmt.h"
#include "core/util.h"
#include "http/chars.h"

namespace velmor::http {

namespace {

enum class SizeLine { ok, bad, too_big };

// chunk-size [ BWS ";" extensions ]: hexadecimal digits and nothing before
// them; the extensions are skipped but may hold no control byte.
SizeLine read_size_line(std::string_view line, std::uint64_t& size) {
  std::size_t i = 0;
  while (i < line.size() && line[i] == '0') ++i;
  std::size_t first = i;
  while (i < line.size() && hex_digit(line[i]) >= 0) ++i;
  if (i == 0) return SizeLine::bad;
  if (i - first > 15) return SizeLine::too_big;
  size = 0;
  for (std::size_t k = first; k < i; ++k) size = size * 16 + static_cast<std::uint64_t>(hex_digit(line[k]));
  std::string_view rest = line.substr(i);
  while (!rest.empty() && is_blank(rest.front())) rest.remove_prefix(1);
  if (rest.empty()) return SizeLine::ok;
  if (rest.front() != ';') return SizeLine::bad;
  bool clean = std::none_of(rest.begin(), rest.end(), [](char c) { return is_control(c) && c != '\t'; });
  return clean ? SizeLine::ok : SizeLine::bad;
}

}  // namespace

ChunkStep ChunkedDecoder::fail(ChunkResult result, std::size_t used, std::string_view why) {
  state_ = State::failed;
  failure_ = result;
  error_ = why;
  return {result, used};
}

ChunkStep ChunkedDecoder::feed(std::string_view input, std::string* body) {
  std::size_t pos = 0;
  for (;;) {
    std::string_view rest = input.substr(pos);
    switch (state_) {
      case State::size: {
        LineReader lines(false);
        std::string_view line;
        LineStep step = lines.next(rest, line);
        // Checked before the line's end is: a piece and the whole agree.
        if ((step == LineStep::line ? line.size() : lines.seen()) > limits_.max_line)
          return fail(ChunkResult::too_big, pos, "a size line too long");
        if (step == LineStep::bad) return fail(ChunkResult::bad, pos, "a size line not ended by CR LF");
        if (step == LineStep::need_more) return {ChunkResult::need_more, pos};
        std::uint64_t size = 0;
        SizeLine read = read_size_line(line, size);
        if (read == SizeLine::bad) return fail(ChunkResult::bad, pos, "a bad chunk size");
        if (read == SizeLine::too_big || size > limits_.max_body - decoded_)
          return fail(ChunkResult::too_big, pos, "the body is too big");
        pos += lines.pos();
        left_ = size;
        state_ = size == 0 ? State::trailer : State::data;
        break;
      }
      case State::data: {
        std::size_t n = static_cast<std::size_t>(std::min<std::uint64_t>(left_, rest.size()));
        if (body) body->append(rest.substr(0, n));
        pos += n;
        left_ -= n;
        decoded_ += n;
        if (left_ > 0) return {ChunkResult::need_more, pos};
        state_ = State::data_end;
        break;
      }
      case State::data_end:
        if (!rest.empty() && rest[0] != '\r') return fail(ChunkResult::bad, pos, "chunk data longer than its size");
        if (rest.size() < 2) return {ChunkResult::need_more, pos};
        if (rest[1] != '\n') return fail(ChunkResult::bad, pos, "chunk data longer than its size");
        pos += 2;
        state_ = State::size;
        break;
      case State::trailer: {
        LineReader lines(false);
        std::string_view line;
        LineStep step = lines.next(rest, line);
        if (trailer_bytes_ + (step == LineStep::line ? lines.pos() : lines.seen()) > limits_.max_trailer_bytes)
          return fail(ChunkResult::too_big, pos, "the trailers are too long");
        if (step == LineStep::bad) return fail(ChunkResult::bad, pos, "a trailer line not ended by CR LF");
        if (step == LineStep::need_more) return {ChunkResult::need_more, pos};
        trailer_bytes_ += lines.pos();
        pos += lines.pos();
        if (line.empty()) {
          state_ = State::done;
          return {ChunkResult::done, pos};
        }
        if (!add_field_line(line, trailers_, FieldFold::refuse)) return fail(ChunkResult::bad, pos, "a bad trailer");
        if (trailers_.size() > limits_.max_trailer_fields) return fail(ChunkResult::too_big, pos, "too many trailers");
        break;
      }
      case State::done:
        return {ChunkResult::done, pos};
      case State::failed:
        return {failure_, pos};
    }
  }
}

std::string chunk_size_line(std::uint64_t size) {
  return strprintf("%llx\r\n", static_cast<unsigned long long>(size));
}

std::string chunk(std::string_view data) {
  if (data.empty()) return {};
  std::string out = chunk_size_line(data.size());
  out += data;
  out += "\r\n";
  return out;
}

std::string last_chunk(const HeaderList& trailers) { return "0\r\n" + trailers.text() + "\r\n"; }

}  // namespace velmor::http
