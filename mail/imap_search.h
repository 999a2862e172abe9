// SEARCH: a command's keys, and their evaluation over the messages of a
// mailbox in bounded steps, so that a search which reads message text runs
// a slice at a time beside everyone else's work (core/background.h).
//
// Keys that the overview answers (flags, dates, sizes, numbers) cost next
// to nothing. Keys that read text (HEADER, FROM, TO, CC, BCC, SUBJECT, BODY,
// TEXT) compare with what a person sees: header words decoded, bodies
// decoded and in UTF-8, both sides folded to one case (mail/mime_text.h).
// A message's text is read once for all its keys, and only when the cheap
// keys leave the answer open; each key's scan is bounded by the size of
// that text (imap_search_text).
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "mail/imap_render.h"

namespace velmor {

class ByteSource;

// How many keys one SEARCH may hold in all (NOT, OR and groups count), and
// how deep they may nest.
inline constexpr std::size_t kSearchKeyLimit = 256;
inline constexpr int kSearchDepthLimit = 32;

struct SearchRange {
  std::uint32_t low = 0, high = 0;
};

struct SearchKey {
  enum class Kind {
    all,
    set,
    uid,
    flag_on,
    flag_off,
    recent,
    new_,
    old,
    keyword,
    unkeyword,
    before,
    on,
    since,
    sent_before,
    sent_on,
    sent_since,
    larger,
    smaller,
    text,  // HEADER, FROM, TO, CC, BCC, SUBJECT, BODY, TEXT: one of the query's atoms
    not_,
    or_,
    group
  } kind = Kind::all;
  std::uint32_t flag = 0;
  std::vector<SearchRange> set;  // sorted, joined
  std::int64_t number = 0;       // a day (imap_day_number) or a size
  std::size_t atom = 0;
  std::vector<SearchKey> sub;
};

// What a text key looks for: a header field's value (an empty needle: the
// field is there), the body's text, or either (TEXT).
struct SearchAtom {
  enum class Scope { header, body, text } scope = Scope::body;
  std::string field{};   // for header
  std::string needle{};  // as the client wrote it
  std::string folded{};  // utf8_fold(needle)
  bool operator==(const SearchAtom& o) const { return scope == o.scope && field == o.field && needle == o.needle; }
};

struct SearchQuery {
  std::vector<SearchKey> keys;  // every one must match
  std::vector<SearchAtom> atoms;
  // The index of an atom, the same for the same one asked twice.
  std::size_t atom(SearchAtom a);
};

// One message as the session's view has it.
struct SearchMessage {
  MessageRecord* record = nullptr;
  std::uint64_t offset = 0;  // in the file the session reads
  std::uint32_t sequence = 0, uid = 0;
  bool recent = false;
};

class SearchRun {
 public:
  // The messages of the view: `at(i)` for i below `count`, nullopt for one
  // expunged meanwhile (it never matches).
  using Lookup = std::function<std::optional<SearchMessage>(std::size_t)>;
  SearchRun(SearchQuery query, std::size_t count) : query_(std::move(query)), count_(count) {}
  // Goes on from where the last call stopped until about `budget` bytes
  // were read or compared; true once every message was looked at. `file`
  // is the mailbox as the session reads it now (nullptr: unreadable).
  bool work(const Lookup& at, ByteSource* file, std::uint64_t budget);
  // The view positions that matched, ascending.
  const std::vector<std::size_t>& matched() const { return matched_; }

 private:
  // A key's answer for the message in hand; open while it depends on text
  // not read yet (`need` then names the atom to read first).
  enum class Tri { no, yes, open };
  Tri eval(const SearchKey& k, const SearchMessage& m, ByteSource* file, std::optional<std::size_t>& need);
  Tri all(const std::vector<SearchKey>& keys, const SearchMessage& m, ByteSource* file,
          std::optional<std::size_t>& need);
  // Reads what the atom needs and answers it; the cost in bytes.
  std::uint64_t resolve(std::size_t atom, const SearchMessage& m, ByteSource* file);

  SearchQuery query_;
  std::size_t count_;
  std::size_t next_ = 0;
  std::vector<std::size_t> matched_;
  // The message in hand: what its text keys gave, and its text once read.
  std::vector<Tri> atoms_;
  std::optional<SearchText> text_;
};

// Days from 1 Jan 1970 to a calendar date (month from 0); SEARCH compares
// dates by the local calendar day.
std::int64_t imap_day_number(int year, int month, int day);

}  // namespace velmor
