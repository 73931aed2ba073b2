// Shared ground for the fuzz targets: reading structured values off an input, failing a run
// with a message that reaches the fuzzer's log, and a scratch directory of the process.
//
// Every target defines LLVMFuzzerTestOneInput, and with PLZC_FUZZ_SEEDS the seeds of its
// corpus: valid inputs made by the library itself, written into DIR when the target is run
// with the argument --seeds=DIR (libFuzzer ignores arguments beginning with "--"). libFuzzer
// calls the target in the fuzz build; in the ordinary build StandaloneMain.cpp runs every file
// of the directories it is given through the same functions.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "Support/SampleData.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);
extern "C" int LLVMFuzzerInitialize(int *argc, char ***argv);

namespace plzcfuzz {

using Bytes = std::vector<uint8_t>;

// Takes fixed-width little-endian values and byte runs off the front of an input. Once the
// input is used up every read gives zeros or nothing, so a target never checks lengths.
class InputReader {
 public:
  InputReader(const uint8_t *data, size_t size) : data_(data), size_(size) {}
  uint8_t u8();
  uint16_t u16();
  uint32_t u32();
  uint64_t u64();
  // Up to count bytes (fewer at the end of the input).
  Bytes bytes(size_t count);
  // A run preceded by its u16 length.
  Bytes piece() { return bytes(u16()); }
  // Everything not read yet.
  Bytes rest() { return bytes(remaining()); }
  size_t remaining() const { return size_ - at_; }

 private:
  const uint8_t *data_;
  size_t size_;
  size_t at_ = 0;
};

// Appends the same encodings; seeds are written with it.
class InputWriter {
 public:
  InputWriter &u8(uint8_t value);
  InputWriter &u16(uint16_t value);
  InputWriter &u32(uint32_t value);
  InputWriter &u64(uint64_t value);
  InputWriter &bytes(const Bytes &value);
  InputWriter &bytes(const std::string &value);
  InputWriter &piece(const Bytes &value);
  InputWriter &piece(const std::string &value);
  const Bytes &data() const { return data_; }

 private:
  Bytes data_;
};

// Reports a broken invariant and aborts the run, which the fuzzer records as a crash. The
// message goes where the sanitizers report (libFuzzer may have closed standard error).
[[noreturn]] void fail(const char *format, ...) __attribute__((format(printf, 1, 2)));

#define FUZZ_CHECK(condition, ...)                   \
  do {                                               \
    if (!(condition)) ::plzcfuzz::fail(__VA_ARGS__); \
  } while (0)

// A directory of this process under $PLZC_FUZZ_SCRATCH, else $PLZC_TEST_DIR, else /dev/shm
// (a volume that holds large attributes); created on first use, removed at exit.
const std::string &scratchDir();

// Creates (or replaces) the file at path with these bytes; false on failure.
bool writeWholeFile(const std::string &path, const Bytes &bytes);

// ---- Seeds ----------------------------------------------------------------------------------

// Writes one target's seeds, each a file named after what it holds.
class SeedSink {
 public:
  explicit SeedSink(std::string dir) : dir_(std::move(dir)) {}
  void add(const std::string &name, const Bytes &input);
  void add(const std::string &name, const std::string &input) { add(name, Bytes(input.begin(), input.end())); }

 private:
  std::string dir_;
};

// With the argument --seeds=DIR, creates DIR, writes the target's seeds into it and exits;
// otherwise does nothing.
void handleSeedMode(int argc, char **argv, void (*writeSeeds)(SeedSink &seeds));

// Defines the target's LLVMFuzzerInitialize around its seed writer.
#define PLZC_FUZZ_SEEDS(writeSeeds)                              \
  extern "C" int LLVMFuzzerInitialize(int *argc, char ***argv) { \
    ::plzcfuzz::handleSeedMode(*argc, *argv, writeSeeds);        \
    return 0;                                                    \
  }

// An XML property list document around body (one value in XML form).
std::string xmlPropertyList(const std::string &body);

// The rules property list of the library's bundle, as shipped.
Bytes bundleRules();

// Sample contents, as the tests make them.
using plzctest::compressibleBytes;
using plzctest::randomBytes;

}  // namespace plzcfuzz
