// The alias table: names (wildcard pattern lists) that stand for local users,
// outside addresses, mailing-list files, archive files, or targets that apply
// only within a time window. Loaded from mail.file.alias at start-up,
// written back by the administration pages.
//
// File format, one alias per line: the name, then targets separated by any
// mix of blanks and commas. Lines starting with '|', '#', a blank or a tab
// are comments. A target is
//   user                 a local user or another alias
//   someone@example.org  an outside address
//   [HH:MM-HH:MM]target  the target, only within that local-time window
//                        (end before start runs past midnight)
//   $path  or  p$th      a list file: one address per line ('%' in front of
//                        a line forces it to be treated as an outside address)
//   #path                an archive file the message is appended to
// A leading '!' on a target is kept and has no effect on delivery.
#pragma once

#include <ctime>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

enum class AliasKind { local, timed, file, remote, list };

struct AliasTarget {
  std::string text;  // without a leading '!' and (for a file) the '#'
  AliasKind kind = AliasKind::local;
  bool bang = false;
};

struct AliasEntry {
  std::string name;  // pattern list for wildcard_match
  std::vector<AliasTarget> targets;
};

// Parses one line; false for a comment or a line without targets.
bool alias_parse_line(std::string_view line, AliasEntry& entry);
AliasTarget alias_parse_target(std::string_view text);
// The saved form of an entry: "name,target,target\n".
std::string alias_entry_text(const AliasEntry& entry);
std::vector<AliasEntry> alias_parse(std::string_view file_text);

// The loaded table (file order).
std::vector<AliasEntry>& alias_table();

// What resolution does with what it finds; debatch fills it with the real
// delivery, tests with a recorder.
class AliasSink {
 public:
  virtual ~AliasSink() = default;
  // The local user of an address, or "" when the address is not local.
  virtual std::string local_user(std::string_view address) = 0;
  virtual bool user_exists(std::string_view user) = 0;
  // Appends the message to the user's mailbox. True when it was dealt with
  // (a failure is recorded by the sink itself).
  virtual bool deliver_local(std::string_view user, std::string_view to_address) = 0;
  // Sends to an outside address (directly or through the outgoing file).
  virtual void deliver_remote(std::string_view address) = 0;
  virtual bool deliver_file(std::string_view path) = 0;
  // The lines of a list file; false when it cannot be read.
  virtual bool read_list(std::string_view path, std::vector<std::string>& lines) = 0;
  // Mail to every member of group `number` ("+N"); true when it was allowed.
  virtual bool deliver_group(int number) = 0;
  virtual void loop_report() = 0;
  // The local time, for timed targets.
  virtual std::tm local_time() = 0;
};

// Resolves a recipient (a local user name, or a full outside address)
// through the table. True when an alias took it ("nobody" is always taken
// and goes nowhere). Nesting is limited to ten
// levels; deeper, or too much work in all, sends one loop report.
bool alias_resolve(const std::vector<AliasEntry>& table, std::string_view recipient,
                   AliasSink& sink);

}  // namespace velmor
