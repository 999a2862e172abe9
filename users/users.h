// The user database: one flat file of login name, password hash ("$1$"),
// full name, home directory and group number. Loaded at start-up and on
// "reload users", written back whole (old file kept as <file>~) after every
// change. User names compare without regard to case.
//
// Every change is saved before it is reported: when the file cannot be
// written the table is put back as it was, the change log gets no record and
// the call fails (user_last_error() then says why). A record pointer from
// user_find() or user_list() stays valid until that user is removed or the
// table is reloaded.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

struct GroupOptions;

struct UserRecord {
  std::string login;
  std::string password_hash;
  std::string full_name;
  std::string home;
  int group = 0;
};

int user_load(const std::string& path);  // 0; 1 cannot open (table empty); 2 no memory
// What user_load does with the file's text: replaces the table with its
// users and keeps the comment lines the file starts with, which every save
// writes back first (the file user_save writes is unchanged). 0; 2 no memory.
int users_parse(std::string_view text);
// The text user_save writes for the table.
std::string users_text();
// Writes the whole table to the file it was loaded from (temporary name,
// fsync, rename; the old file kept as <file>~; mode 0600). 0; an errno value
// when the file could not be written, the old file then left as it was.
int user_save();
// By login name, then dotted full name ("ann.lee"), then initials ("a.lee").
const UserRecord* user_find(std::string_view key);
// 0 correct; 1 no such user, no stored hash or no password; 2 wrong.
int user_check_password(std::string_view name, std::string_view password);
// How a change to the table went; anything but `done` leaves the table, the
// file and the change log as they were, and user_last_error() says why.
enum class UserChange {
  done,
  bad_field,  // a field is empty, too long, or holds what the file cannot carry (comma, CR, LF, NUL)
  exists,     // the login is taken already (user_add)
  not_found,  // no such user
  not_saved,  // the file could not be written
};
UserChange user_add(std::string_view name, std::string_view password, std::string_view full_name,
                    std::string_view home, int group);
UserChange user_set_password(std::string_view name, std::string_view password);
UserChange user_set_home(std::string_view name, std::string_view home);
UserChange user_set_name(std::string_view name, std::string_view full_name);
UserChange user_set_group(std::string_view name, int group);
UserChange user_remove(std::string_view name);
// Why the last change that failed was refused ("the full name holds a comma").
const std::string& user_last_error();
std::string user_home(std::string_view name);        // "" when unknown
std::string user_full_name(std::string_view name);   // "" when unknown
bool user_exists(std::string_view name);
// The user's group set; the default group when the name is empty or unknown
// or its group has no set; nullptr when no groups are loaded at all.
std::shared_ptr<const GroupOptions> user_group(std::string_view name);
std::vector<const UserRecord*> user_list();  // in file order
// A fresh password of `length` letters and digits (no look-alikes such as 0
// and O) from the kernel's random source.
std::string random_password(std::size_t length = 12);

}  // namespace velmor
