#include "core/textfile.h"

#include "core/filecache.h"

namespace velmor {

std::optional<std::string> read_text_file(const std::string& path) {
  CacheFile file = filecache_open(path, FileMode::read);
  if (!file) return std::nullopt;
  std::string text;
  for (std::string_view part; !(part = filecache_view(file, text.size())).empty();) text += part;
  filecache_purge(file);
  return text;
}

}  // namespace velmor
