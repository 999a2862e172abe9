#include "core/background.h"

#include <algorithm>
#include <utility>
#include <vector>

#include "core/log.h"

namespace velmor {

namespace {

struct Piece {
  std::uint64_t id;
  std::string name;
  std::function<bool()> slice;
};

// The list outlives every handle: a handle destroyed at exit, after the list,
// finds it torn down and does nothing.
bool g_torn_down = false;
struct Registry {
  std::vector<Piece> pieces;
  ~Registry() { g_torn_down = true; }
};
std::vector<Piece>& pieces() {
  static Registry registry;
  return registry.pieces;
}
std::uint64_t g_next_id = 1;
std::size_t g_start = 0;  // the round begins here, one further each round

Piece* find(std::uint64_t id) {
  for (Piece& p : pieces())
    if (p.id == id) return &p;
  return nullptr;
}

// Runs one piece's slice; a slice that throws is logged and counts as done,
// so one faulty piece never stops the loop or the others.
bool run(std::uint64_t id) {
  Piece* p = find(id);
  if (!p) return false;
  std::function<bool()> slice = p->slice;  // the piece may leave during its slice
  std::string name = p->name;
  bool more = false;
  try {
    more = slice();
  } catch (const std::exception& e) {
    log_write("Background work " + name + " failed: " + e.what(), logchan::errors, kLogUnbuffered);
  } catch (...) {
    log_write("Background work " + name + " failed", logchan::errors, kLogUnbuffered);
  }
  return more;
}

}  // namespace

BackgroundWork::BackgroundWork(std::string name, std::function<bool()> slice) : id_(g_next_id++) {
  pieces().push_back({id_, std::move(name), std::move(slice)});
}

BackgroundWork::~BackgroundWork() {
  if (id_ == 0 || g_torn_down) return;
  std::erase_if(pieces(), [id = id_](const Piece& p) { return p.id == id; });
}

BackgroundWork::BackgroundWork(BackgroundWork&& other) noexcept : id_(std::exchange(other.id_, 0)) {}

BackgroundWork& BackgroundWork::operator=(BackgroundWork&& other) noexcept {
  if (this != &other) {
    BackgroundWork gone(std::move(*this));
    id_ = std::exchange(other.id_, 0);
  }
  return *this;
}

bool background_round() {
  std::vector<Piece>& list = pieces();
  if (list.empty()) return false;
  std::vector<std::uint64_t> order;
  order.reserve(list.size());
  std::size_t n = list.size();
  g_start %= n;
  for (std::size_t i = 0; i < n; ++i) order.push_back(list[(g_start + i) % n].id);
  ++g_start;
  bool more = false;
  for (std::uint64_t id : order) more = run(id) || more;
  return more;
}

void background_settle() {
  std::vector<std::uint64_t> order;
  for (const Piece& p : pieces()) order.push_back(p.id);
  for (std::uint64_t id : order) run(id);
}

std::size_t background_count() { return pieces().size(); }

}  // namespace velmor
