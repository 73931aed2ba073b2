#include "FuzzSupport.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "Platform/Bundle.h"
#include "PropertyValue.h"

// Present when a sanitizer runtime is linked in: prints to the report descriptor, which
// libFuzzer keeps open when it closes standard error (-close_fd_mask=2).
extern "C" __attribute__((weak)) void __sanitizer_report_error_summary(const char *summary);

namespace plzcfuzz {

uint8_t InputReader::u8() { return at_ < size_ ? data_[at_++] : 0; }

uint16_t InputReader::u16() {
  uint16_t low = u8();
  return static_cast<uint16_t>(low | u8() << 8);
}

uint32_t InputReader::u32() {
  uint32_t low = u16();
  return low | static_cast<uint32_t>(u16()) << 16;
}

uint64_t InputReader::u64() {
  uint64_t low = u32();
  return low | static_cast<uint64_t>(u32()) << 32;
}

Bytes InputReader::bytes(size_t count) {
  count = std::min(count, remaining());
  Bytes out(data_ + at_, data_ + at_ + count);
  at_ += count;
  return out;
}

InputWriter &InputWriter::u8(uint8_t value) {
  data_.push_back(value);
  return *this;
}

InputWriter &InputWriter::u16(uint16_t value) {
  return u8(static_cast<uint8_t>(value)).u8(static_cast<uint8_t>(value >> 8));
}

InputWriter &InputWriter::u32(uint32_t value) {
  return u16(static_cast<uint16_t>(value)).u16(static_cast<uint16_t>(value >> 16));
}

InputWriter &InputWriter::u64(uint64_t value) {
  return u32(static_cast<uint32_t>(value)).u32(static_cast<uint32_t>(value >> 32));
}

InputWriter &InputWriter::bytes(const Bytes &value) {
  data_.insert(data_.end(), value.begin(), value.end());
  return *this;
}

InputWriter &InputWriter::bytes(const std::string &value) { return bytes(Bytes(value.begin(), value.end())); }

InputWriter &InputWriter::piece(const Bytes &value) {
  return u16(static_cast<uint16_t>(value.size()))
      .bytes(Bytes(value.begin(), value.begin() + std::min<size_t>(value.size(), 65535)));
}

InputWriter &InputWriter::piece(const std::string &value) { return piece(Bytes(value.begin(), value.end())); }

void fail(const char *format, ...) {
  char message[1024];
  va_list arguments;
  va_start(arguments, format);
  vsnprintf(message, sizeof message, format, arguments);
  va_end(arguments);
  if (__sanitizer_report_error_summary) {
    std::string summary = std::string("plenzo fuzz invariant: ") + message;
    __sanitizer_report_error_summary(summary.c_str());
  } else {
    fprintf(stderr, "plenzo fuzz invariant: %s\n", message);
  }
  abort();
}

namespace {

std::string makeScratchDir() {
  const char *base = getenv("PLZC_FUZZ_SCRATCH");
  if (!base || !*base) base = getenv("PLZC_TEST_DIR");
  if (!base || !*base) base = "/dev/shm";
  std::string pattern = std::string(base) + "/plzc-fuzz-XXXXXX";
  if (!mkdtemp(pattern.data())) fail("mkdtemp %s: %s", pattern.c_str(), strerror(errno));
  return pattern;
}

// Never destroyed: the exit handler that removes the directory still needs its name.
const std::string *gScratchDir = nullptr;

void removeScratchDir() {
  std::error_code ignored;
  std::filesystem::remove_all(*gScratchDir, ignored);
}

}  // namespace

const std::string &scratchDir() {
  static const bool made = [] {
    gScratchDir = new std::string(makeScratchDir());
    atexit(removeScratchDir);
    return true;
  }();
  (void)made;
  return *gScratchDir;
}

bool writeWholeFile(const std::string &path, const Bytes &bytes) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t wrote = write(fd, bytes.data() + done, bytes.size() - done);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote <= 0) break;
    done += static_cast<size_t>(wrote);
  }
  return close(fd) == 0 && done == bytes.size();
}

void SeedSink::add(const std::string &name, const Bytes &input) {
  std::string path = dir_ + "/" + name;
  if (!writeWholeFile(path, input)) fail("cannot write the seed %s: %s", path.c_str(), strerror(errno));
}

void handleSeedMode(int argc, char **argv, void (*writeSeeds)(SeedSink &seeds)) {
  static constexpr char kFlag[] = "--seeds=";
  for (int i = 1; i < argc; i++) {
    if (strncmp(argv[i], kFlag, sizeof kFlag - 1) != 0) continue;
    std::string dir = argv[i] + sizeof kFlag - 1;
    std::error_code error;
    std::filesystem::create_directories(dir, error);
    if (error) fail("cannot create %s: %s", dir.c_str(), error.message().c_str());
    SeedSink seeds(dir);
    writeSeeds(seeds);
    exit(0);
  }
}

std::string xmlPropertyList(const std::string &body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
         "<plist version=\"1.0\">\n" +
         body + "\n</plist>\n";
}

Bytes bundleRules() {
  std::string path;
  if (!platform::bundleResourcePath("com.tavix.Plenzo", "SystemCompressionRules", "plist", &path))
    fail("the bundle has no SystemCompressionRules.plist");
  PVDataRef data = PVDataCreateWithContentsOfFile(path.c_str());
  if (!data) fail("cannot read %s", path.c_str());
  Bytes bytes(PVDataGetBytePtr(data), PVDataGetBytePtr(data) + PVDataGetLength(data));
  PVRelease(data);
  return bytes;
}

}  // namespace plzcfuzz
