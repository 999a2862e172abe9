// The user database. The table keeps the file's 32 buckets (the sum of the
// first four characters of the lower-cased login, & 31) because the file is
// written in bucket order; within a bucket users stay in file order, so a
// saved file reloads to the same table and saving twice changes nothing.
#include "users/users.h"

#include <sys/random.h>
#include <sys/stat.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <new>
#include <optional>

#include "core/filecache.h"
#include "core/log.h"
#include "core/strfmt.h"
#include "core/textfile.h"
#include "core/util.h"
#include "users/groups.h"

namespace velmor {

namespace {

constexpr int kBuckets = 32;
constexpr std::size_t kMaxHome = 255;
constexpr std::size_t kMaxHash = 64;
constexpr char kCryptAlphabet[] = "./0123456789ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz";

using Bucket = std::vector<std::unique_ptr<UserRecord>>;

struct UserTable {
  std::array<Bucket, kBuckets> buckets;
  std::string header;  // the comment lines the file starts with, written back as they were
  std::string path;
  std::string last_error;
};

UserTable& table() {
  static UserTable t;
  return t;
}

int bucket_of(std::string_view name) {
  int sum = 0;
  for (std::size_t i = 0; i < name.size() && i < 4; ++i) {
    char c = name[i];
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    sum += static_cast<signed char>(c);
  }
  return sum & (kBuckets - 1);
}

// A user by login name only, ignoring case.
UserRecord* find_login(std::string_view name) {
  if (name.empty()) return nullptr;
  for (auto& user : table().buckets[bucket_of(name)]) {
    if (str_iequals(user->login, name)) return user.get();
  }
  return nullptr;
}

char lower(char c) { return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c; }

// The full name with every blank as a dot ("Ann Lee" -> "ann.lee").
bool dotted_name_is(std::string_view full_name, std::string_view key) {
  if (full_name.size() != key.size()) return false;
  for (std::size_t i = 0; i < key.size(); ++i) {
    char c = full_name[i] == ' ' ? '.' : full_name[i];
    if (lower(c) != lower(key[i])) return false;
  }
  return true;
}

// The full name in initials form: every word but the last as its first
// letter and a dot, then the last word whole ("Eve Ray Moss" -> "e.r.moss").
std::string initials_of(std::string_view full_name) {
  std::vector<std::string_view> words;
  std::size_t i = 0;
  while (i < full_name.size()) {
    while (i < full_name.size() && full_name[i] == ' ') ++i;
    std::size_t start = i;
    while (i < full_name.size() && full_name[i] != ' ') ++i;
    if (i > start) words.push_back(full_name.substr(start, i - start));
  }
  std::string out;
  for (std::size_t w = 0; w + 1 < words.size(); ++w) {
    out += words[w][0];
    out += '.';
  }
  if (!words.empty()) out += words.back();
  return out;
}

// Why `value` cannot be stored in a field of the user file, or "".
std::string field_problem(const char* what, std::string_view value) {
  for (char c : value) {
    if (c == ',') return strprintf("the %s holds a comma", what);
    if (c == '\r' || c == '\n') return strprintf("the %s holds a line break", what);
    if (c == '\0') return strprintf("the %s holds a NUL byte", what);
  }
  return {};
}

std::string login_problem(std::string_view name) {
  if (name.empty()) return "the login name is empty";
  if (name[0] == '|') return "the login name starts with \"|\"";
  for (char c : name) {
    if (static_cast<unsigned char>(c) <= ' ' || c == 0x7f) {
      return "the login name holds a blank or a control character";
    }
  }
  return field_problem("login name", name);
}

std::string home_problem(std::string_view home) {
  if (home.size() > kMaxHome) return "the home directory is longer than 255 characters";
  return field_problem("home directory", home);
}

// A password may hold commas (only its hash reaches the user file), but not
// line breaks or NULs, which would forge records in the change log.
std::string password_problem(std::string_view password) {
  for (char c : password) {
    if (c == '\r' || c == '\n' || c == '\0') {
      return "the password holds a line break or a NUL byte";
    }
  }
  return {};
}

// Records why a change failed; returns false so callers can `return refuse(...)`.
bool refuse(std::string why) {
  table().last_error = std::move(why);
  return false;
}

// `count` characters of `alphabet` from the kernel's random source; bytes
// past the largest multiple of the alphabet's size are drawn again, so every
// character is equally likely.
std::string random_chars(std::size_t count, std::string_view alphabet) {
  const unsigned limit = 256 - 256 % alphabet.size();
  std::string out;
  while (out.size() < count) {
    unsigned char bytes[32];
    ssize_t n = getrandom(bytes, sizeof bytes, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    for (ssize_t i = 0; i < n && out.size() < count; ++i) {
      if (bytes[i] < limit) out += alphabet[bytes[i] % alphabet.size()];
    }
  }
  return out;
}

std::string new_salt() { return random_chars(5, kCryptAlphabet); }

std::optional<UserRecord> parse_line(std::string_view line) {
  if (line.empty() || line[0] == ' ' || line[0] == '\t' || line[0] == '|') return std::nullopt;
  std::size_t comma = line.find(',');
  if (comma == std::string_view::npos) return std::nullopt;
  std::string_view fields[5];
  int n = 0;
  std::size_t start = 0;
  while (n < 5) {
    std::size_t end = line.find(',', start);
    fields[n++] = line.substr(start, end == std::string_view::npos ? end : end - start);
    if (end == std::string_view::npos) break;
    start = end + 1;
  }
  UserRecord user;
  user.login = fields[0];
  user.password_hash = fields[1];
  user.full_name = fields[2];
  user.home = fields[3];
  std::string_view group = trim_blanks(fields[4]);
  if (!group.empty() && group[0] == '+') group.remove_prefix(1);
  std::from_chars(group.data(), group.data() + group.size(), user.group);
  return user;
}

// Joined rather than printed with "%s", so a NUL byte read from the file is
// written back instead of cutting its field short.
std::string record_line(const UserRecord& u) {
  return u.login + ',' + u.password_hash + ',' + u.full_name + ',' + u.home + ',' +
         std::to_string(u.group) + '\n';
}

// Saves the table; on failure runs `undo`, so the table matches the file.
template <typename Undo>
bool save_or_undo(Undo undo) {
  int err = user_save();
  if (err == 0) return true;
  undo();
  return refuse(strprintf("the user file %s could not be written: %s", table().path.c_str(),
                          std::strerror(err)));
}

// Applies a change to one field of a user, saves, and writes the change-log
// record "<tag>:<login>,<note>"; puts the field back when the file cannot be
// written.
template <typename Field>
UserChange change_field(std::string_view name, Field UserRecord::*field, Field value, const char* tag,
                        std::string_view note) {
  UserRecord* user = find_login(name);
  if (!user) {
    refuse(strprintf("no user %.*s", static_cast<int>(name.size()), name.data()));
    return UserChange::not_found;
  }
  Field old = std::move(user->*field);
  user->*field = std::move(value);
  if (!save_or_undo([&] { user->*field = std::move(old); })) return UserChange::not_saved;
  user_change_note(strprintf("%s:%s,%.*s", tag, user->login.c_str(), static_cast<int>(note.size()),
                             note.data()));
  return UserChange::done;
}

// Records why a field is refused.
UserChange bad_field(std::string why) {
  refuse(std::move(why));
  return UserChange::bad_field;
}

}  // namespace

int user_load(const std::string& path) {
  UserTable& t = table();
  t.path = path;
  t.header.clear();
  for (auto& bucket : t.buckets) bucket.clear();
  try {
    std::optional<std::string> text = path.empty() ? std::nullopt : read_text_file(path);
    if (!text) return 1;
    return users_parse(*text);
  } catch (const std::bad_alloc&) {
    return 2;
  }
}

namespace {

// The comment ("|") and empty lines the file starts with, as they are.
// Lines end where for_each_line ends them (at a CR too), so no user line
// is ever taken into the header and written back twice.
std::string_view header_of(std::string_view text) {
  std::size_t pos = 0;
  while (pos < text.size()) {
    std::size_t end = text.find_first_of("\r\n", pos);
    std::string_view line = text.substr(pos, end == std::string_view::npos ? std::string_view::npos : end - pos);
    if (!line.empty() && line[0] != '|') break;
    pos = end == std::string_view::npos ? text.size() : end + 1;
  }
  return text.substr(0, pos);
}

}  // namespace

int users_parse(std::string_view text) {
  UserTable& t = table();
  for (auto& bucket : t.buckets) bucket.clear();
  t.header.clear();
  try {
    t.header = header_of(text);
    if (!t.header.empty() && t.header.back() != '\n') t.header += '\n';
    for_each_line(text, [&](std::string_view line) {
      if (auto user = parse_line(line)) {
        int b = bucket_of(user->login);
        t.buckets[b].push_back(std::make_unique<UserRecord>(std::move(*user)));
      }
    });
  } catch (const std::bad_alloc&) {
    return 2;  // the users read so far stay
  }
  return 0;
}

std::string users_text() {
  std::string text = table().header;
  for (const auto& bucket : table().buckets) {
    for (const auto& user : bucket) text += record_line(*user);
  }
  return text;
}

int user_save() {
  UserTable& t = table();
  if (t.path.empty()) return ENOENT;
  int err = file_write_atomic(t.path, users_text(), true, 0600);
  // The backup holds password hashes too, whatever mode the old file had.
  if (err == 0) ::chmod((t.path + "~").c_str(), 0600);
  if (err != 0) {
    std::printf("Couldn't open user database file to save\n");
    std::fflush(stdout);
    log_message("Couldn't save user database file: ", t.path + ": " + std::strerror(err));
  }
  return err;
}

const UserRecord* user_find(std::string_view key) {
  if (key.empty()) return nullptr;
  if (const UserRecord* user = find_login(key)) return user;
  for (const auto& bucket : table().buckets) {
    for (const auto& user : bucket) {
      if (!user->full_name.empty() && dotted_name_is(user->full_name, key)) return user.get();
    }
    for (const auto& user : bucket) {
      if (!user->full_name.empty() && str_iequals(initials_of(user->full_name), key)) {
        return user.get();
      }
    }
  }
  return nullptr;
}

int user_check_password(std::string_view name, std::string_view password) {
  // Settings that no stored hash can equal keep the time of a failed lookup
  // close to that of a wrong password, so timing does not reveal who exists.
  static const std::string no_user_setting = "$1$nouser$";
  if (password.empty()) return 1;
  const UserRecord* user = user_find(name);
  if (!user || user->password_hash.empty()) {
    (void)md5_crypt(password, no_user_setting);
    return 1;
  }
  std::string hash = md5_crypt(password, user->password_hash);
  return constant_time_equals(hash, user->password_hash) ? 0 : 2;
}

UserChange user_add(std::string_view name, std::string_view password, std::string_view full_name,
                    std::string_view home, int group) {
  for (const std::string& why : {login_problem(name), password_problem(password),
                                 field_problem("full name", full_name), home_problem(home)}) {
    if (!why.empty()) return bad_field(why);
  }
  if (find_login(name)) {
    refuse(strprintf("the user %.*s exists already", static_cast<int>(name.size()), name.data()));
    return UserChange::exists;
  }
  auto user = std::make_unique<UserRecord>();
  user->login = name;
  user->password_hash = md5_crypt(password, new_salt());
  user->full_name = full_name;
  user->home = home;
  user->group = group;
  const UserRecord& added = *user;
  Bucket& bucket = table().buckets[bucket_of(name)];
  bucket.push_back(std::move(user));
  if (!save_or_undo([&] { bucket.pop_back(); })) return UserChange::not_saved;
  user_change_note(strprintf("add:%s,%s,%s,%s,%d", added.login.c_str(),
                             added.password_hash.c_str(), added.full_name.c_str(),
                             added.home.c_str(), added.group));
  return UserChange::done;
}

UserChange user_set_password(std::string_view name, std::string_view password) {
  if (std::string why = password_problem(password); !why.empty()) return bad_field(why);
  std::string hash = md5_crypt(password, new_salt());
  if (hash.size() > kMaxHash) return bad_field("the password hash is too long");
  return change_field(name, &UserRecord::password_hash, std::move(hash), "pass", password);
}

UserChange user_set_home(std::string_view name, std::string_view home) {
  if (std::string why = home_problem(home); !why.empty()) return bad_field(why);
  return change_field(name, &UserRecord::home, std::string(home), "dir", home);
}

UserChange user_set_name(std::string_view name, std::string_view full_name) {
  if (std::string why = field_problem("full name", full_name); !why.empty()) return bad_field(why);
  return change_field(name, &UserRecord::full_name, std::string(full_name), "name", full_name);
}

UserChange user_set_group(std::string_view name, int group) {
  return change_field(name, &UserRecord::group, group, "group", std::to_string(group));
}

UserChange user_remove(std::string_view name) {
  if (name.empty()) return UserChange::not_found;
  Bucket& bucket = table().buckets[bucket_of(name)];
  for (std::size_t i = 0; i < bucket.size(); ++i) {
    if (!str_iequals(bucket[i]->login, name)) continue;
    std::unique_ptr<UserRecord> removed = std::move(bucket[i]);
    bucket.erase(bucket.begin() + static_cast<std::ptrdiff_t>(i));
    auto undo = [&] {
      bucket.insert(bucket.begin() + static_cast<std::ptrdiff_t>(i), std::move(removed));
    };
    if (!save_or_undo(undo)) return UserChange::not_saved;
    user_change_note("remove:" + removed->login);
    return UserChange::done;
  }
  refuse(strprintf("no user %.*s", static_cast<int>(name.size()), name.data()));
  return UserChange::not_found;
}

const std::string& user_last_error() { return table().last_error; }

std::string user_home(std::string_view name) {
  const UserRecord* user = user_find(name);
  return user ? user->home : std::string();
}

std::string user_full_name(std::string_view name) {
  const UserRecord* user = user_find(name);
  return user ? user->full_name : std::string();
}

bool user_exists(std::string_view name) { return user_find(name) != nullptr; }

std::shared_ptr<const GroupOptions> user_group(std::string_view name) {
  if (const UserRecord* user = user_find(name)) {
    if (auto group = group_find(user->group)) return group;
  }
  return group_default();
}

std::string random_password(std::size_t length) {
  return random_chars(length, "abcdefghijkmnpqrstuvwxyzABCDEFGHJKLMNPQRSTUVWXYZ23456789");
}

std::vector<const UserRecord*> user_list() {
  std::vector<const UserRecord*> out;
  for (const auto& bucket : table().buckets) {
    for (const auto& user : bucket) out.push_back(user.get());
  }
  return out;
}

}  // namespace velmor
