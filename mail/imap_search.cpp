#include "mail/imap_search.h"

#include <algorithm>
#include <ctime>

#include "core/util.h"
#include "mail/mailfile.h"
#include "mail/mime_text.h"

namespace velmor {

namespace {

// What looking at a message costs the budget when no text is read.
constexpr std::uint64_t kMessageCost = 64;

bool in_set(const std::vector<SearchRange>& set, std::uint32_t n) {
  auto it = std::upper_bound(set.begin(), set.end(), n, [](std::uint32_t v, const SearchRange& r) { return v < r.low; });
  return it != set.begin() && std::prev(it)->high >= n;
}

// The local calendar day of a time, on the scale of imap_day_number.
std::int64_t day_of(std::time_t t) {
  std::tm tm{};
  if (!localtime_r(&t, &tm)) return 0;
  return imap_day_number(tm.tm_year + 1900, tm.tm_mon, tm.tm_mday);
}

}  // namespace

std::int64_t imap_day_number(int year, int month, int day) {
  int y = year - (month < 2 ? 1 : 0);
  int era = (y >= 0 ? y : y - 399) / 400;
  int yoe = y - era * 400;
  int mp = (month + 10) % 12;
  int doy = (153 * mp + 2) / 5 + day - 1;
  int doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return static_cast<std::int64_t>(era) * 146097 + doe - 719468;
}

std::size_t SearchQuery::atom(SearchAtom a) {
  for (std::size_t i = 0; i < atoms.size(); ++i)
    if (atoms[i] == a) return i;
  a.folded = utf8_fold(a.needle);
  atoms.push_back(std::move(a));
  return atoms.size() - 1;
}

// Every key of `keys` holds: no as soon as one does not, open while any is
// open (`need` names the text to read for the first such one).
SearchRun::Tri SearchRun::all(const std::vector<SearchKey>& keys, const SearchMessage& m, ByteSource* file,
                              std::optional<std::size_t>& need) {
  std::optional<std::size_t> first;
  bool open = false;
  for (const SearchKey& k : keys) {
    std::optional<std::size_t> n;
    Tri t = eval(k, m, file, n);
    if (t == Tri::no) return Tri::no;
    if (t == Tri::open && !open) {
      open = true;
      first = n;
    }
  }
  if (!open) return Tri::yes;
  need = first;
  return Tri::open;
}

SearchRun::Tri SearchRun::eval(const SearchKey& k, const SearchMessage& m, ByteSource* file,
                               std::optional<std::size_t>& need) {
  using K = SearchKey::Kind;
  const MessageRecord& r = *m.record;
  auto tri = [](bool b) { return b ? Tri::yes : Tri::no; };
  switch (k.kind) {
    case K::all:
      return Tri::yes;
    case K::set:
      return tri(in_set(k.set, m.sequence));
    case K::uid:
      return tri(in_set(k.set, m.uid));
    case K::flag_on:
      return tri((r.flags & k.flag) != 0);
    case K::flag_off:
      return tri((r.flags & k.flag) == 0);
    case K::recent:
      return tri(m.recent);
    case K::new_:
      return tri(m.recent && !(r.flags & msgflag::seen));
    case K::old:
      return tri(!m.recent);
    case K::keyword:
      return Tri::no;
    case K::unkeyword:
      return Tri::yes;
    case K::before:
      return tri(day_of(r.internal_date) < k.number);
    case K::on:
      return tri(day_of(r.internal_date) == k.number);
    case K::since:
      return tri(day_of(r.internal_date) >= k.number);
    case K::sent_before:
      return tri(r.sent_date && day_of(r.sent_date) < k.number);
    case K::sent_on:
      return tri(r.sent_date && day_of(r.sent_date) == k.number);
    case K::sent_since:
      return tri(r.sent_date && day_of(r.sent_date) >= k.number);
    case K::larger:
    case K::smaller: {
      auto size = file ? imap_message_size(*file, *m.record, m.offset) : std::nullopt;
      if (!size) return Tri::no;
      return tri(k.kind == K::larger ? *size > static_cast<std::uint64_t>(k.number)
                                     : *size < static_cast<std::uint64_t>(k.number));
    }
    case K::text: {
      Tri& t = atoms_[k.atom];
      if (t == Tri::open) {
        // The overview's first line of From, To and Subject answers many
        // searches without reading the file (where it has no encoded words,
        // it is what decoding would give).
        const SearchAtom& a = query_.atoms[k.atom];
        const std::string* known = a.scope != SearchAtom::Scope::header ? nullptr
                                   : str_iequals(a.field, "FROM")        ? &r.from
                                   : str_iequals(a.field, "TO")          ? &r.to
                                   : str_iequals(a.field, "SUBJECT")     ? &r.subject
                                                                         : nullptr;
        if (known && !a.needle.empty() && known->find("=?") == std::string::npos && str_casestr(*known, a.needle))
          t = Tri::yes;
      }
      if (t == Tri::open) need = k.atom;
      return t;
    }
    case K::not_: {
      Tri t = eval(k.sub[0], m, file, need);
      return t == Tri::open ? t : tri(t == Tri::no);
    }
    case K::or_: {
      std::optional<std::size_t> n0, n1;
      Tri a = eval(k.sub[0], m, file, n0);
      if (a == Tri::yes) return a;
      Tri b = eval(k.sub[1], m, file, n1);
      if (b == Tri::yes || (a == Tri::no && b == Tri::no)) return b;
      need = a == Tri::open ? n0 : n1;
      return Tri::open;
    }
    case K::group:
      return all(k.sub, m, file, need);
  }
  return Tri::no;
}

std::uint64_t SearchRun::resolve(std::size_t atom, const SearchMessage& m, ByteSource* file) {
  using Scope = SearchAtom::Scope;
  const SearchAtom& a = query_.atoms[atom];
  if (!text_) text_.emplace();
  const std::uint64_t before = text_->cost;
  if (!file || !imap_search_text(*file, *m.record, m.offset, a.scope != Scope::header, *text_)) {
    atoms_[atom] = Tri::no;
    return kMessageCost;
  }
  std::uint64_t cost = text_->cost - before;
  bool found = false;
  if (a.scope != Scope::body) {
    for (const auto& [name, value] : text_->fields) {
      if (a.scope == Scope::header && !str_iequals(name, a.field)) continue;
      cost += value.size();
      if (value.find(a.folded) != std::string::npos) {
        found = true;
        break;
      }
    }
  }
  if (!found && a.scope != Scope::header) {
    cost += text_->body.size();
    found = text_->body.find(a.folded) != std::string::npos;
  }
  atoms_[atom] = found ? Tri::yes : Tri::no;
  return cost + kMessageCost;
}

bool SearchRun::work(const Lookup& at, ByteSource* file, std::uint64_t budget) {
  std::uint64_t spent = 0;
  while (next_ < count_) {
    if (spent >= budget) return false;
    if (atoms_.size() != query_.atoms.size()) atoms_.assign(query_.atoms.size(), Tri::open);
    std::optional<SearchMessage> m = at(next_);
    Tri r = Tri::no;
    if (m && m->record) {
      std::optional<std::size_t> need;
      spent += kMessageCost;
      r = all(query_.keys, *m, file, need);
      if (r == Tri::open) {
        spent += resolve(*need, *m, file);
        continue;
      }
    }
    if (r == Tri::yes) matched_.push_back(next_);
    ++next_;
    atoms_.clear();
    text_.reset();
  }
  return true;
}

}  // namespace velmor
