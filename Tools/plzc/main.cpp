// plzc: compress files in place into extended attributes, read them back and inspect them.
#include <cstdio>
#include <cstring>
#include <string>

#include "Cli.h"
#include "Common/ChunkEngine.h"
#include "Console.h"
#include "Platform/SystemResources.h"

#ifndef PLZC_VERSION
#define PLZC_VERSION "unknown"
#endif

namespace {

struct Subcommand {
  const char *name;
  int (*run)(int argc, char **argv);
};

const Subcommand kSubcommands[] = {
    {"compress", plzc::compressCommand}, {"decompress", plzc::decompressCommand}, {"cat", plzc::catCommand},
    {"info", plzc::infoCommand},         {"volume", plzc::volumeCommand},         {"toc", plzc::tocCommand},
    {"demo", plzc::demoCommand},         {"install", plzc::installCommand},       {"repair", plzc::repairCommand},
    {"mount", plzc::mountCommand},
};

void printHelp() {
  printf(
      "Usage: plzc COMMAND [OPTION]... [ARGUMENT]...\n"
      "Compress files in place into their extended attributes, read them back, and inspect them.\n"
      "A compressed file keeps its name and its data as every reader of this library sees it.\n"
      "\n"
      "Commands:\n"
      "  compress [-t 3,4] [-l LEVEL] [--verify] [--toc FILE] [--large-forks] [-j N] PATH...\n"
      "                        compress files and whole trees in place (or into a table of\n"
      "                        contents), with N worker threads; --async through the\n"
      "                        compression queue\n"
      "  install [--options FILE] [-t 3,4] [-l LEVEL] [--rules FILE] [--skip-macho TYPES] SRC... DEST\n"
      "                        copy files and trees to DEST as new files, compressed on the way\n"
      "  decompress [--verify] [--user-space] PATH...\n"
      "                        turn compressed files back into plain files\n"
      "  repair [-n] PATH...   find files a crash left half-done and make each whole again\n"
      "  cat PATH...           write the files' data to standard output\n"
      "  info [-r] PATH...     type, logical size, stored size and ratio of files; with -r, a\n"
      "                        summary of each tree\n"
      "  volume PATH...        can the volume hold compressed files, and why not\n"
      "  toc list FILE         list the records of a table-of-contents file\n"
      "  mount [-f] [-o OPTION[,...]] DIR MOUNTPOINT\n"
      "                        serve DIR through FUSE at MOUNTPOINT, its compressed files read\n"
      "                        as plain ones; unmount with 'fusermount3 -u MOUNTPOINT'\n"
      "  demo [DIR]            compress a generated corpus under DIR (default /dev/shm), print the\n"
      "                        savings and check that every file reads back byte for byte\n"
      "\n"
      "  -h, --help            show this help; 'plzc COMMAND --help' shows a command's options\n"
      "  -V, --version         show the version\n"
      "\n"
      "Messages go to standard error and name the file and the cause; a progress line is drawn\n"
      "only when standard error is a terminal. Exit status: 0 on success, 1 when a file or an\n"
      "operation failed, 2 on a usage error.\n");
}

}  // namespace

int main(int argc, char **argv) {
  platform::keepFreedMemory();
  if (argc < 2) return plzc::usageError("", "missing COMMAND");
  const char *word = argv[1];
  if (!strcmp(word, "-h") || !strcmp(word, "--help") || !strcmp(word, "help")) {
    printHelp();
    return plzc::kExitSuccess;
  }
  if (!strcmp(word, "-V") || !strcmp(word, "--version")) {
    printf("plzc (Plenzo) %s\n", PLZC_VERSION);
    // The chunk engines built in, with their libraries' versions.
    printf("engines:");
    for (ChunkEngine engine : {ChunkEngine::Zlib, ChunkEngine::Libdeflate, ChunkEngine::Isal})
      if (chunkEngineBuilt(engine)) printf(" %s %s", chunkEngineName(engine), chunkEngineVersion(engine));
    printf("\n");
    return plzc::kExitSuccess;
  }
  for (const Subcommand &subcommand : kSubcommands)
    if (!strcmp(word, subcommand.name)) return subcommand.run(argc - 1, argv + 1);
  if (word[0] == '-') return plzc::usageError("", std::string("unknown option '") + word + "'");
  return plzc::usageError("", std::string("unknown command '") + word + "'");
}
