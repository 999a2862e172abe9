// The resolver's cache: records learned from answers, by owner name.
//
// Every record carries the time it expires (its TTL, a day at most);
// expired records are never returned. A fresh answer replaces the name's
// records of that type. The cache holds at most `max_names` names; when a
// new name needs room the one used least recently is dropped.
#pragma once

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <list>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "dns/message.h"

namespace velmor::dns {

inline constexpr std::uint32_t kMaxTtl = 86400;
inline constexpr std::size_t kCacheNames = 10000;

struct CachedRecord {
  std::uint16_t type = 0;
  std::uint16_t rclass = 0;
  std::time_t expires = 0;  // usable while now < expires
  std::uint16_t preference = 0;
  std::string data;
};

class Cache {
 public:
  explicit Cache(std::size_t max_names = kCacheNames) : max_names_(max_names) {}

  // The unexpired records of `name` (any case), newest answer's order; the
  // name counts as used. Empty when nothing usable is kept.
  std::vector<CachedRecord> find(std::string_view name, std::time_t now);

  // Stores the records of one answer: for each owner name and type in
  // `records` the name's older records of that type are replaced. Records
  // with TTL 0 are not kept; duplicates are kept once.
  void store(const std::vector<Record>& records, std::time_t now);

  std::size_t size() const { return nodes_.size(); }
  void clear();

 private:
  struct Node {
    std::vector<CachedRecord> records;
    std::list<std::string>::iterator use;  // position in use_order_
  };
  Node& node_for(const std::string& key);

  std::size_t max_names_;
  std::unordered_map<std::string, Node> nodes_;
  std::list<std::string> use_order_;  // most recently used first
};

}  // namespace velmor::dns
