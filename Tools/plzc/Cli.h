// What the subcommands of plzc share: their entry points, exit statuses, option parsing helpers
// and interruption.
#pragma once

#include <getopt.h>

#include <cstdint>
#include <string>
#include <vector>

namespace plzc {

// Exit statuses of every subcommand.
enum ExitStatus : int {
  kExitSuccess = 0,
  kExitFailure = 1,  // a file or an operation failed
  kExitUsage = 2,    // the command line could not be understood
  kExitInterrupted = 130,
};

// Subcommands: argv[0] is the subcommand's name, the rest its arguments. Each returns an exit
// status.
int compressCommand(int argc, char **argv);
int decompressCommand(int argc, char **argv);
int catCommand(int argc, char **argv);
int infoCommand(int argc, char **argv);
int volumeCommand(int argc, char **argv);
int tocCommand(int argc, char **argv);
int demoCommand(int argc, char **argv);
int installCommand(int argc, char **argv);
int repairCommand(int argc, char **argv);
int mountCommand(int argc, char **argv);

// Parses the subcommand's options with getopt_long, silently (opterr 0). Returns the option's
// value, -1 at the end of the options, or '?' after printing what was wrong with the
// command line ("plzc compress: unknown option '--x'") and how to get help.
int nextOption(const char *command, int argc, char **argv, const char *shortOptions, const option *longOptions);

// Prints "plzc COMMAND: MESSAGE" and the help hint on standard error; returns kExitUsage.
int usageError(const char *command, const std::string &message);

// Parses a whole decimal number in [min, max]; false when text is anything else.
bool parseNumber(const char *text, long min, long max, long *out);

// -j N: the number of files worked on at once, 1 to 1024. Returns kExitSuccess with *jobs
// set, or kExitUsage after saying what was wrong.
int chooseJobs(const char *command, const char *text, int *jobs);

// -t LIST: the compression types tried, "3", "4", "3,4" or "4,3" (each type at most once).
// Returns kExitSuccess with *types set, or kExitUsage after saying what was wrong.
int chooseTypes(const char *command, const char *text, std::string *types);
// -l N: the compression level, 1 to 9. Returns kExitSuccess with *level set, or kExitUsage
// after saying what was wrong.
int chooseLevel(const char *command, const char *text, long *level);

// --engine NAME: makes NAME ("zlib", "libdeflate", "isal") the chunk engine of this run.
// Returns kExitSuccess, or kExitUsage after saying what was wrong (not an engine, or not built
// into this plzc).
int chooseEngine(const char *command, const char *name);
// --fast: the fast engine at its fastest level (level 1), speed over size.
int chooseFastEngine(const char *command, long *level);
// The help lines of --engine and --fast, aligned at column 21 of the option list.
extern const char kEngineHelp[];
extern const char kFastHelp[];

// The arguments left after the options.
std::vector<std::string> operands(int argc, char **argv);

// Number of processors this process may run on.
int availableProcessors();

// SIGINT and SIGTERM set a flag that long work checks between files; a second signal ends the
// process at once.
void installInterruptHandler();
bool interrupted();

// "12.3 MiB" style sizes, "1:05" durations.
std::string humanBytes(uint64_t bytes);
std::string humanDuration(double seconds);

}  // namespace plzc
