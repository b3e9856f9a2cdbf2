#include "support/JournalLogSink.h"

#include <sys/stat.h>
#include <syslog.h>
#include <systemd/sd-journal.h>

#include <string>

namespace tamber {

JournalLogSink::JournalLogSink(const char* subsystem, const char* category)
    : subsystem_(subsystem), category_(category) {}

bool JournalLogSink::available() {
    struct stat st {};
    return ::stat("/run/systemd/journal/socket", &st) == 0 && S_ISSOCK(st.st_mode);
}

void JournalLogSink::write(LogLevel level, std::string_view line) {
    int priority = level == LogLevel::Error  ? LOG_ERR
                   : level == LogLevel::Info ? LOG_INFO
                                             : LOG_DEBUG;
    std::string message(line);
    sd_journal_send("MESSAGE=%s", message.c_str(), "PRIORITY=%d", priority, "SUBSYSTEM=%s",
                    subsystem_, "CATEGORY=%s", category_, "SYSLOG_IDENTIFIER=tamber", nullptr);
}

}  // namespace tamber
