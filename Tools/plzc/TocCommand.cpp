// plzc toc list: the records of a table-of-contents file.
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "Cli.h"
#include "Console.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "TocFile.h"

namespace plzc {

namespace {

void printHelp() {
  printf(
      "Usage: plzc toc list FILE\n"
      "List the records of a table of contents written by 'plzc compress --toc': for each file,\n"
      "its path and the compressed attributes recorded for it, with their sizes; a header\n"
      "attribute is decoded (type, logical size). A malformed file is rejected as a whole, with\n"
      "the byte where it goes wrong.\n"
      "\n"
      "  -h, --help  show this help and exit\n"
      "\n"
      "Exit status: 0 when the file was listed, 1 when it cannot be read or is malformed, 2 on a\n"
      "usage error.\n");
}

std::string describeValue(const TocEntry &entry, const std::vector<uint8_t> &bytes) {
  if (entry.name != kDecmpfsXattrName) return "";
  if (entry.length < sizeof(DiskHeader)) return "; too short for a compression header";
  DiskHeader header;
  memcpy(&header, bytes.data() + entry.valueOffset, sizeof header);
  if (header.magic != kDecmpfsMagic) return "; not a compression header (wrong magic)";
  return "; type " + std::to_string(header.compressionType) + ", " + std::to_string(header.uncompressedSize) +
         " bytes logical";
}

}  // namespace

int tocCommand(int argc, char **argv) {
  const char *command = "toc";
  static const option kOptions[] = {{"help", no_argument, nullptr, 'h'}, {nullptr, 0, nullptr, 0}};
  for (int c; (c = nextOption(command, argc, argv, "h", kOptions)) != -1;) {
    if (c != 'h') return kExitUsage;
    printHelp();
    return kExitSuccess;
  }
  std::vector<std::string> words = operands(argc, argv);
  if (words.empty()) return usageError(command, "missing action: the one action is 'list FILE'");
  if (words[0] != "list") return usageError(command, "unknown action '" + words[0] + "': the one action is 'list FILE'");
  if (words.size() != 2) return usageError(command, words.size() < 2 ? "missing FILE" : "list takes one FILE");
  const std::string &path = words[1];

  std::vector<uint8_t> bytes;
  if (!readWholeFile(path, &bytes)) {
    report("%s: %s\n", path.c_str(), strerror(errno));
    return kExitFailure;
  }
  std::vector<TocRecord> records;
  TocError error;
  if (!parseToc(bytes, &records, &error)) {
    report("%s: malformed table of contents at byte %zu: %s\n", path.c_str(), error.offset, error.reason.c_str());
    return kExitFailure;
  }
  Console console(false, false);
  for (const TocRecord &record : records) {
    console.out("%s\n", record.path.c_str());
    for (const TocEntry &entry : record.entries)
      console.out("  %s: %u bytes%s\n", entry.name.c_str(), entry.length, describeValue(entry, bytes).c_str());
  }
  return kExitSuccess;
}

}  // namespace plzc
