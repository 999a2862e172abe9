// The scheduler. Once a minute, at the first main-loop tick within its first
// thirty seconds, every due task runs: internal command words at once, shell
// commands as children that the main loop reaps, so a slow command never
// holds up the suite. Its result is logged when it ends.
#include "core/scheduler.h"

#include <cctype>
#include <climits>
#include <ctime>

#include "core/commands.h"
#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/process.h"
#include "core/textfile.h"

namespace velmor {

namespace {

constexpr std::size_t kMaxField = 31;
constexpr std::size_t kMaxCommand = 255;

std::time_t last_run_minute = -1;

bool is_blank(char c) { return c == ' ' || c == '\t'; }
bool is_digit(char c) { return std::isdigit(static_cast<unsigned char>(c)) != 0; }

// Reads the digits at `pos` (none gives 0), capped so that no field overflows.
int read_number(std::string_view text, std::size_t& pos) {
  long n = 0;
  while (pos < text.size() && is_digit(text[pos])) {
    if (n < INT_MAX / 10) n = n * 10 + (text[pos] - '0');
    ++pos;
  }
  return static_cast<int>(n);
}

// One task line: five time fields and the command. False for short lines
// and for fields or commands that are too long.
bool parse_task(std::string_view line, ScheduleTask& task) {
  std::string* fields[] = {&task.mins, &task.hours, &task.wdays, &task.mdays, &task.months};
  std::size_t pos = 0;
  for (std::string* field : fields) {
    while (pos < line.size() && is_blank(line[pos])) ++pos;
    std::size_t start = pos;
    while (pos < line.size() && !is_blank(line[pos])) ++pos;
    if (pos == start || pos - start > kMaxField) return false;
    field->assign(line.substr(start, pos - start));
  }
  while (pos < line.size() && is_blank(line[pos])) ++pos;
  if (pos >= line.size() || line.size() - pos > kMaxCommand) return false;
  task.command.assign(line.substr(pos));
  return true;
}

void run_task(const ScheduleTask& task) {
  if (internal_command(task.command)) return;
  std::string command = task.command;
  int pid = run_shell(command, [command](int status) {
    log_message(status == 0 ? "Scheduler - executed OK:" : "Scheduler - execution failed:", command);
  });
  if (pid < 0) log_message("Scheduler - execution failed:", command);
}

}  // namespace

std::vector<ScheduleTask>& schedule_tasks() {
  static std::vector<ScheduleTask> tasks;
  return tasks;
}

bool field_match(std::string_view field, int value) {
  if (field.empty() || field[0] == '#') return false;
  if (field[0] == '*') return true;
  std::size_t pos = 0;
  while (pos < field.size()) {
    while (pos < field.size() && !is_digit(field[pos])) ++pos;
    if (pos >= field.size()) break;
    int first = read_number(field, pos);
    if (pos < field.size() && field[pos] == '-') {
      ++pos;
      int last = read_number(field, pos);
      int step = 1;
      if (pos < field.size() && field[pos] == '/') {
        ++pos;
        step = read_number(field, pos);
      }
      // A step of 0 would never move on: it matches nothing.
      if (step > 0 && value >= first && value <= last && (value - first) % step == 0) return true;
    } else if (value == first) {
      return true;
    }
  }
  return false;
}

int schedule_load() {
  progress_code = 150000;
  auto& tasks = schedule_tasks();
  tasks.clear();
  const std::string& path = text_of(config.file_schedule);
  if (path.empty()) return 0;
  std::optional<std::string> text = read_text_file(path);
  if (!text) return 0;  // no task file: nothing to run
  tasks = schedule_parse(*text);
  return 0;
}

std::vector<ScheduleTask> schedule_parse(std::string_view text) {
  std::vector<ScheduleTask> tasks;
  for_each_line(text, [&](std::string_view line) {
    if (line.empty() || line[0] == '|' || is_blank(line[0])) return;
    ScheduleTask task;
    if (parse_task(line, task)) tasks.push_back(std::move(task));
    else log_message("Scheduler - task line not understood, ignored: ", line.substr(0, 80));
  });
  return tasks;
}

std::string schedule_text(const std::vector<ScheduleTask>& tasks) {
  std::string text;
  for (const auto& t : tasks)
    text += t.mins + " " + t.hours + " " + t.wdays + " " + t.mdays + " " + t.months + " " + t.command + "\n";
  return text;
}

int schedule_save() { return file_write_atomic(text_of(config.file_schedule), schedule_text(schedule_tasks())); }

void schedule_poll() {
  if (server_now % 60 > 29) return;
  std::time_t minute = server_now / 60;
  if (minute == last_run_minute) return;  // this minute's tasks have run
  last_run_minute = minute;
  progress_code = 150100;
  std::tm now{};
  localtime_r(&server_now, &now);
  for (const auto& task : schedule_tasks()) {
    bool due = field_match(task.mins, now.tm_min) && field_match(task.hours, now.tm_hour) &&
               (field_match(task.wdays, now.tm_wday) || field_match(task.mdays, now.tm_mday)) &&
               field_match(task.months, now.tm_mon);
    if (due) run_task(task);
  }
}

}  // namespace velmor
