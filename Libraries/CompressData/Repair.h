// Finding the files that an interrupted compression or decompression left half-done, and
// making each whole again.
//
// The steps that change a file in place are ordered so that, whatever moment the process dies
// at, every byte of the file survives in one of the states below, and the state itself shows
// where the data is:
//
//   compressed form written, data fork whole, no compressed flag   the data fork is the data
//   compressed form whole, data fork empty, no compressed flag     the compressed form is
//   compressed flag, compressed form whole, data fork partly or    the compressed form is; the
//     wholly written by a decompression                            data fork is checked against it
//   no header, a compressor's resource fork beside the data fork   the data fork is; the fork is
//                                                                  checked against it
//   segments of the attribute layer that no value owns             (never read by anyone)
//
// "Whole" is proven, never assumed: every chunk must decode completely with its Adler-32
// check, and the chunks together must give exactly the header's size. A file whose state
// cannot be proven is left exactly as it is, and the report says why. Repair must not run
// while another process works on the same files.
#pragma once

#include <string>

enum class RepairVerdict {
  Clean,      // nothing half-done; the file was not changed
  Repaired,   // made whole (or would be, in a dry run)
  LeftAlone,  // a state that cannot be proven: not changed
  Failed,     // a step of the repair failed (the cause is in the action)
};

struct RepairReport {
  RepairVerdict verdict = RepairVerdict::Clean;
  std::string state;   // what was found; empty when the file is clean
  std::string action;  // what was done, or would be, or why nothing was
};

// Examines the regular file at path and, unless dryRun, repairs it. Anything but a regular
// file is reported clean. Never throws.
RepairReport repairFile(const char *path, bool dryRun);
