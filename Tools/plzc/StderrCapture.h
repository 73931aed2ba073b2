// Catching what a library call prints on standard error, for calls whose only report of a
// failure is a message there.
#pragma once

#include <functional>
#include <string>

namespace plzc {

// Runs call with descriptor 2 sent to a memory file and returns what was written there. Changes
// a process-wide descriptor: only one thread may print on standard error meanwhile.
std::string captureStderr(const std::function<void()> &call);

}  // namespace plzc
