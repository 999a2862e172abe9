// Any text as an alias file: alias_parse never crashes, the saved table reads
// back as the same table, and resolving through it (timed windows, list
// files, loops) ends without crashing.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "mail/alias.h"

namespace {

using namespace velmor;

std::string saved_text(const std::vector<AliasEntry>& table) {
  std::string out;
  for (const AliasEntry& e : table) out += alias_entry_text(e);
  return out;
}

// Every user exists and takes mail; a list file holds the alias names.
class Sink : public AliasSink {
 public:
  explicit Sink(const std::vector<AliasEntry>& table) : table_(table) {}
  std::string local_user(std::string_view a) override { return std::string(a.substr(0, a.find('@'))); }
  bool user_exists(std::string_view) override { return true; }
  bool deliver_local(std::string_view, std::string_view) override { return true; }
  void deliver_remote(std::string_view) override {}
  bool deliver_file(std::string_view) override { return true; }
  bool read_list(std::string_view, std::vector<std::string>& lines) override {
    for (std::size_t i = 0; i < table_.size() && i < 8; ++i) lines.push_back(table_[i].name);
    return true;
  }
  bool deliver_group(int) override { return true; }
  void loop_report() override {}
  std::tm local_time() override {
    std::tm t{};
    t.tm_hour = 12;
    return t;
  }

 private:
  const std::vector<AliasEntry>& table_;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::vector<AliasEntry> table = alias_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  std::string saved = saved_text(table);
  if (saved_text(alias_parse(saved)) != saved) {
    std::fprintf(stderr, "the alias file changed on reading it back:\n%s", saved.c_str());
    std::abort();
  }
  Sink sink(table);
  for (std::size_t i = 0; i < table.size() && i < 4; ++i) alias_resolve(table, table[i].name, sink);
  return 0;
}
