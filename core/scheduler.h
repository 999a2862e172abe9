// The scheduler: tasks at given minutes, hours, weekdays, days of the month
// and months (0 = January), each an internal command word or a shell command.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace velmor {

struct ScheduleTask {
  std::string mins, hours, wdays, mdays, months;
  std::string command;
};

int schedule_load();   // reads config.file_schedule; a missing file is an empty list
int schedule_save();   // writes the list back
// The tasks of a task file's text, and the text schedule_save writes.
std::vector<ScheduleTask> schedule_parse(std::string_view text);
std::string schedule_text(const std::vector<ScheduleTask>& tasks);
void schedule_poll();  // once per main-loop iteration
bool field_match(std::string_view field, int value);
std::vector<ScheduleTask>& schedule_tasks();

}  // namespace velmor
