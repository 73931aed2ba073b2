#include "Totals.h"

#include <cstdio>

#include "Cli.h"

namespace plzc {

Totals AtomicTotals::snapshot() const {
  Totals totals;
  totals.files = files.load();
  totals.compressed = compressed.load();
  totals.alreadyCompressed = alreadyCompressed.load();
  totals.leftPlain = leftPlain.load();
  totals.empty = empty.load();
  totals.failed = failed.load();
  for (uint32_t i = 0; i < kTypeSlots; i++) totals.byType[i] = byType[i].load();
  totals.logicalBytes = logicalBytes.load();
  totals.storedBytes = storedBytes.load();
  return totals;
}

std::string typeBreakdown(const Totals &totals) {
  std::string text;
  for (uint32_t type = 0; type < kTypeSlots; type++) {
    if (!totals.byType[type]) continue;
    if (!text.empty()) text += ", ";
    text += (type == kTypeSlots - 1 ? "type " + std::to_string(type) + "+" : "type " + std::to_string(type)) + ": " +
            std::to_string(totals.byType[type]);
  }
  return text.empty() ? "none" : text;
}

std::string formatTotals(const Totals &totals, const std::string &prefix) {
  std::string files = std::to_string(totals.files) + ": " + std::to_string(totals.compressed) + " compressed";
  if (totals.compressed) files += " (" + typeBreakdown(totals) + ")";
  auto add = [&](uint64_t count, const char *what) {
    if (count) files += ", " + std::to_string(count) + " " + what;
  };
  add(totals.alreadyCompressed, "already compressed");
  add(totals.leftPlain, "not compressed");
  add(totals.empty, "empty");
  add(totals.failed, "failed");

  auto bytes = [](uint64_t count) {
    return std::to_string(count) + " bytes (" + humanBytes(count) + ")";
  };
  char savings[96];
  int64_t saved = static_cast<int64_t>(totals.logicalBytes) - static_cast<int64_t>(totals.storedBytes);
  double percent = totals.logicalBytes ? 100.0 * static_cast<double>(saved) / static_cast<double>(totals.logicalBytes) : 0;
  snprintf(savings, sizeof savings, "%lld bytes (%.1f%%)", static_cast<long long>(saved), percent);

  return prefix + "files       " + files + "\n" + prefix + "logical     " + bytes(totals.logicalBytes) + "\n" + prefix +
         "stored      " + bytes(totals.storedBytes) + "\n" + prefix + "savings     " + savings + "\n";
}

}  // namespace plzc
