// SPDX-License-Identifier: MIT
// The system log on a Linux host is the journal. Without a journal (containers, test machines)
// every write is dropped silently: logging must never be the reason a request fails.
#include <sys/uio.h>

#include <string>

#include "platform/SystemLog.h"

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

namespace halvex {

namespace {

// The journal takes large entries, but a runaway message should not become one.
constexpr std::size_t kMaxLogMessage = std::size_t{16} * 1024;

const char* priorityField(LogLevel level) {
  switch (level) {
    case LogLevel::kDebug: return "PRIORITY=7";
    case LogLevel::kInfo: return "PRIORITY=6";
    case LogLevel::kNotice: return "PRIORITY=5";
    case LogLevel::kWarning: return "PRIORITY=4";
    case LogLevel::kError: return "PRIORITY=3";
  }
  return "PRIORITY=6";
}

class JournalLogServer final : public LogServer {
 public:
  void write(const LogContext& context, LogLevel level, std::string_view message) override {
    // Fields are passed with explicit lengths, so neither a '%' nor a NUL in the text matters;
    // sd_journal_sendv encodes values with newlines itself. It is thread-safe.
    std::string text = "MESSAGE=";
    text.append(message.substr(0, kMaxLogMessage));
    std::string subsystem = "SUBSYSTEM=" + context.subsystem();
    std::string category = "CATEGORY=" + context.category();
    const char* priority = priorityField(level);
    iovec fields[] = {
        {text.data(), text.size()},
        {const_cast<char*>(priority), std::char_traits<char>::length(priority)},
        {subsystem.data(), subsystem.size()},
        {category.data(), category.size()},
    };
    sd_journal_sendv(fields, static_cast<int>(std::size(fields)));
  }
};

}  // namespace

std::shared_ptr<LogServer> LogServer::create() {
  return std::make_shared<JournalLogServer>();
}

}  // namespace halvex
