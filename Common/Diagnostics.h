// Diagnostics: every message that starts with the source position.
//
// Each source file defines `kSourcePath`, the path it prints ("Common/pathUtils"), and writes
// its messages with the full format, position included:
//
//   PLZC_ERR("%s:%d: open %s: %s\n", path, strerror(errno));
//
// The macros supply the path and the line as the first two arguments. errno is preserved, so a
// function may print and then return -1 with the errno of the failing call.
#pragma once

#include <cstdio>

namespace plzc {

// Prints `format` to `stream` with the given arguments; keeps errno.
void diagnostic(FILE *stream, const char *format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace plzc

#define PLZC_ERR(format, ...) ::plzc::diagnostic(stderr, format, kSourcePath, __LINE__ __VA_OPT__(, ) __VA_ARGS__)
#define PLZC_OUT(format, ...) ::plzc::diagnostic(stdout, format, kSourcePath, __LINE__ __VA_OPT__(, ) __VA_ARGS__)
