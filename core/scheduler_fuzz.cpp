// Any text as a task file: schedule_parse never crashes, every field can be
// matched, and the tasks come back the same after schedule_text and a
// second parse.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "core/scheduler.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  auto tasks = schedule_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  for (const ScheduleTask& t : tasks) {
    for (const std::string* field : {&t.mins, &t.hours, &t.wdays, &t.mdays, &t.months})
      for (int value : {0, 1, 12, 31, 59}) (void)field_match(*field, value);
  }
  std::string saved = schedule_text(tasks);
  if (schedule_text(schedule_parse(saved)) != saved) {
    std::fprintf(stderr, "the task file changed on reading it back:\n%s", saved.c_str());
    std::abort();
  }
  return 0;
}
