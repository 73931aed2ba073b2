#include "Platform/SystemLog.h"

#include <syslog.h>

#include <atomic>
#include <cerrno>

namespace plzc {
namespace {

std::atomic<SystemLogSink> gSink{::vsyslog};

}  // namespace

void systemLog(int priority, const char *format, ...) {
  int savedErrno = errno;
  va_list arguments;
  va_start(arguments, format);
  gSink.load(std::memory_order_acquire)(priority, format, arguments);
  va_end(arguments);
  errno = savedErrno;
}

SystemLogSink setSystemLogSink(SystemLogSink sink) {
  return gSink.exchange(sink ? sink : ::vsyslog, std::memory_order_acq_rel);
}

}  // namespace plzc
