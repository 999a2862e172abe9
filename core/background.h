// Background work: what a subsystem has in hand between ticks (debatching,
// compaction, a long search, an expunge), served in short slices after each
// dispatcher pass. Every subsystem joins the one list; the loop serves each
// piece once per round, starting each round one piece further on, so no piece
// is always first and a busy one cannot starve the others. A piece bounds its
// own slice (a few milliseconds) and returns true while more remains, so the
// next pass looks only for ready I/O instead of waiting for the tick.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace velmor {

// A piece of background work. `slice` runs one bounded slice and returns
// true while work remains. When the suite stops (`quit_flag` set) it is
// called once more to settle what it holds; it must not start anything new.
class BackgroundWork {
 public:
  BackgroundWork() = default;
  BackgroundWork(std::string name, std::function<bool()> slice);
  ~BackgroundWork();  // leaves the list (safe from inside any slice)
  BackgroundWork(BackgroundWork&& other) noexcept;
  BackgroundWork& operator=(BackgroundWork&& other) noexcept;
  BackgroundWork(const BackgroundWork&) = delete;
  BackgroundWork& operator=(const BackgroundWork&) = delete;

  bool joined() const { return id_ != 0; }

 private:
  std::uint64_t id_ = 0;
};

// One round: each joined piece's slice once (pieces that joined during the
// round wait for the next). True while any piece has more.
bool background_round();
// The suite stops: every piece settles once.
void background_settle();
// How many pieces are joined (tests).
std::size_t background_count();

}  // namespace velmor
