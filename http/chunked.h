// The chunked transfer coding: a decoder that resumes over whatever part of
// the body has arrived, and the pieces an encoder writes.
//
// The decoder is strict where parsers that disagree let a second message be
// smuggled inside a first: a size is hexadecimal digits only (no sign,
// "0x" or blank before it), every line ends with CR LF, the data of a chunk
// is followed by CR LF and nothing else, and trailers may not fold.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "http/headers.h"

namespace velmor::http {

enum class ChunkResult { need_more, done, too_big, bad };

struct ChunkLimits {
  std::size_t max_line = 4096;  // a size line with its extensions, without CR LF
  std::size_t max_trailer_bytes = 16 * 1024;
  std::size_t max_trailer_fields = 100;
  std::uint64_t max_body = UINT64_MAX;  // decoded bytes
};

struct ChunkStep {
  ChunkResult result;
  std::size_t used;  // bytes of the input consumed: drop them before the next call
};

class ChunkedDecoder {
 public:
  explicit ChunkedDecoder(ChunkLimits limits = {}) : limits_(limits) {}
  // Decodes from the start of `input` (what is left of the body). The data
  // goes to `body` when one is given (a relay that only needs the end passes
  // none); a line not yet whole is left unconsumed for the next call. On
  // done, used() ends exactly after the last CR LF: later bytes are the next
  // message.
  ChunkStep feed(std::string_view input, std::string* body = nullptr);
  const HeaderList& trailers() const { return trailers_; }
  std::uint64_t body_size() const { return decoded_; }
  std::string_view error() const { return error_; }

 private:
  enum class State { size, data, data_end, trailer, done, failed };
  ChunkStep fail(ChunkResult result, std::size_t used, std::string_view why);

  ChunkLimits limits_;
  State state_ = State::size;
  ChunkResult failure_ = ChunkResult::bad;
  std::uint64_t left_ = 0;  // data bytes of this chunk still to come
  std::uint64_t decoded_ = 0;
  std::size_t trailer_bytes_ = 0;
  HeaderList trailers_;
  std::string_view error_;
};

// One chunk: its size line, the data and CR LF. Empty data gives nothing
// (an empty chunk would end the body).
std::string chunk(std::string_view data);
// The size line alone, for data sent as a file range; CR LF follows the data.
std::string chunk_size_line(std::uint64_t size);
// The last chunk, the trailers and the blank line.
std::string last_chunk(const HeaderList& trailers = {});

}  // namespace velmor::http
