// The default installation tree, embedded at build time from defaults/.
#pragma once

#include <string_view>
#include <vector>

namespace velmor {

struct DefaultFile {
  std::string_view path;  // relative to the installation root
  std::string_view data;
};
const std::vector<DefaultFile>& default_files();

}  // namespace velmor
