#include "Common/Diagnostics.h"

#include <cerrno>
#include <cstdarg>

namespace plzc {

void diagnostic(FILE *stream, const char *format, ...) {
  int savedErrno = errno;
  va_list arguments;
  va_start(arguments, format);
  vfprintf(stream, format, arguments);
  va_end(arguments);
  // Standard output may be a pipe or a file; keep the order of the two streams as printed.
  if (stream != stderr) fflush(stream);
  errno = savedErrno;
}

}  // namespace plzc
