// The resolver's cache (see cache.h).
#include "dns/cache.h"

#include <algorithm>
#include <set>
#include <utility>

namespace velmor::dns {

std::vector<CachedRecord> Cache::find(std::string_view name, std::time_t now) {
  auto it = nodes_.find(name_key(name));
  if (it == nodes_.end()) return {};
  Node& node = it->second;
  std::erase_if(node.records, [now](const CachedRecord& r) { return r.expires <= now; });
  if (node.records.empty()) {
    use_order_.erase(node.use);
    nodes_.erase(it);
    return {};
  }
  use_order_.splice(use_order_.begin(), use_order_, node.use);
  return node.records;
}

Cache::Node& Cache::node_for(const std::string& key) {
  auto it = nodes_.find(key);
  if (it != nodes_.end()) {
    use_order_.splice(use_order_.begin(), use_order_, it->second.use);
    return it->second;
  }
  while (!use_order_.empty() && nodes_.size() >= max_names_) {
    nodes_.erase(use_order_.back());
    use_order_.pop_back();
  }
  use_order_.push_front(key);
  Node& node = nodes_[key];
  node.use = use_order_.begin();
  return node;
}

void Cache::store(const std::vector<Record>& records, std::time_t now) {
  // Owner and type of each group of the answer, so that older records of
  // the group are dropped once, before the first new one goes in.
  std::set<std::pair<std::string, std::uint16_t>> replaced;
  for (const Record& r : records) {
    if (r.ttl == 0) continue;
    std::string key = name_key(r.name);
    Node& node = node_for(key);
    if (replaced.emplace(key, r.type).second)
      std::erase_if(node.records, [&](const CachedRecord& c) { return c.type == r.type; });
    const bool duplicate = std::any_of(node.records.begin(), node.records.end(), [&](const CachedRecord& c) {
      return c.type == r.type && c.rclass == r.rclass && c.preference == r.preference && c.data == r.data;
    });
    if (duplicate) continue;
    node.records.push_back({r.type, r.rclass, now + static_cast<std::time_t>(std::min(r.ttl, kMaxTtl)),
                            r.preference, r.data});
  }
}

void Cache::clear() {
  nodes_.clear();
  use_order_.clear();
}

}  // namespace velmor::dns
