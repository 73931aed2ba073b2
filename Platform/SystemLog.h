// The system log.
//
// Messages the library sends to syslog go through systemLog, never straight to the C library,
// so that tests can capture them: a test installs its own sink for the process and reads back
// each message's priority and text.
#pragma once

#include <cstdarg>

namespace plzc {

// Receives one message: a syslog priority (LOG_ERR, ...) and a printf format with its
// arguments, exactly as vsyslog does. The default sink is vsyslog itself.
using SystemLogSink = void (*)(int priority, const char *format, va_list arguments);

// Sends one message to the current sink. Thread-safe; keeps errno.
void systemLog(int priority, const char *format, ...) __attribute__((format(printf, 2, 3)));

// Makes `sink` receive every later message of the process; nullptr restores vsyslog.
// Returns the sink it replaces. Meant for tests; thread-safe.
SystemLogSink setSystemLogSink(SystemLogSink sink);

}  // namespace plzc
