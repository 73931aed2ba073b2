// catFile throughput on a large type-4 file, against raw zlib inflate of the same chunks.
//
//   catFileBench [size-MiB] [repetitions]
//
// Makes a file of log-like text (256 MiB by default) in $PLZC_TEST_DIR (or /dev/shm),
// compresses it in place, then times, best of the repetitions for each:
//   - catFile of the file with standard output on /dev/null;
//   - the baseline: the fork's chunk table read into memory once, then every chunk inflated
//     into one 64 KiB buffer with zlib, on one thread.
// Both outputs are checked against the original data once, outside the timed runs. Prints both
// throughputs in MB/s (10^6 bytes of logical data per second) and their ratio, for the engine
// in use (PLZC_ENGINE, default libdeflate); the target is a ratio of at least 0.8 with zlib and
// 2.0 with the faster engines.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "Common/ChunkEngine.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Plenzo.h"

namespace {

constexpr uint32_t kChunkSize = 65536;
constexpr uint32_t kChunkCountPosition = 260;  // fork offset of the chunk count; table offsets count from here
double targetRatio() { return currentChunkEngine() == ChunkEngine::Zlib ? 0.8 : 2.0; }

double secondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// Log lines as a web server writes them: time, client, method, path, status, size, agent.
class LogText {
 public:
  std::string next(size_t size) {
    static const char *const kMethods[] = {"GET", "GET", "GET", "POST", "PUT", "DELETE"};
    static const char *const kPaths[] = {"/index.html", "/api/v2/items", "/api/v2/users", "/static/app.js",
                                         "/static/style.css", "/images/logo.png", "/search", "/login"};
    static const char *const kAgents[] = {"Mozilla/5.0 (X11; Linux x86_64)", "curl/7.88.1",
                                          "Mozilla/5.0 (Windows NT 10.0; Win64; x64)", "python-requests/2.28"};
    static const int kStatuses[] = {200, 200, 200, 200, 304, 404, 500, 201};
    std::string text;
    text.reserve(size + 256);
    char line[256];
    while (text.size() < size) {
      uint32_t r = random();
      time_ += r % 3;
      unsigned day = 1 + (time_ / 86400) % 28, hour = (time_ / 3600) % 24, minute = (time_ / 60) % 60,
               second = time_ % 60;
      int length = snprintf(line, sizeof line,
                            "2024-03-%02u %02u:%02u:%02u 10.%u.%u.%u %s %s?id=%u %d %u \"%s\"\n",
                            day, hour, minute, second,
                            (r >> 4) & 15, (r >> 8) & 255, (r >> 16) & 255, kMethods[(r >> 24) % 6],
                            kPaths[(r >> 27) % 8], random() % 100000, kStatuses[(r >> 1) & 7], random() % 65536,
                            kAgents[(r >> 5) & 3]);
      text.append(line, static_cast<size_t>(length));
    }
    text.resize(size);
    return text;
  }

 private:
  uint32_t random() {
    state_ = state_ * 6364136223846793005ull + 1442695040888963407ull;
    return static_cast<uint32_t>(state_ >> 33);
  }
  uint64_t state_ = 42;
  uint32_t time_ = 0;
};

[[noreturn]] void fail(const char *what) {
  fprintf(stderr, "catFileBench: %s: %s\n", what, strerror(errno));
  exit(1);
}

uint32_t loadLE32(const uint8_t *bytes) {
  return static_cast<uint32_t>(bytes[0]) | static_cast<uint32_t>(bytes[1]) << 8 |
         static_cast<uint32_t>(bytes[2]) << 16 | static_cast<uint32_t>(bytes[3]) << 24;
}

struct Chunk {
  const uint8_t *bytes;
  uint32_t length;
};

// Inflates every chunk into one 64 KiB buffer; returns the logical bytes produced and, when
// crc is given, the CRC-32 of all of them.
uint64_t inflateAll(const std::vector<Chunk> &chunks, uLong *crc) {
  static uint8_t output[kChunkSize];
  z_stream stream{};
  if (inflateInit(&stream) != Z_OK) fail("inflateInit");
  uint64_t total = 0;
  for (const Chunk &chunk : chunks) {
    uint32_t produced;
    if (chunk.bytes[0] == 0xFF) {  // stored chunk: the marker, then the raw bytes
      produced = chunk.length - 1;
      memcpy(output, chunk.bytes + 1, produced);
    } else {
      inflateReset(&stream);
      stream.next_in = const_cast<uint8_t *>(chunk.bytes);
      stream.avail_in = chunk.length;
      stream.next_out = output;
      stream.avail_out = sizeof output;
      if (inflate(&stream, Z_FINISH) != Z_STREAM_END) {
        errno = EIO;
        fail("inflate");
      }
      produced = static_cast<uint32_t>(sizeof output - stream.avail_out);
    }
    if (crc) *crc = crc32(*crc, output, produced);
    total += produced;
  }
  inflateEnd(&stream);
  return total;
}

// Runs catFile with standard output sent to fd; returns the seconds it took.
double timedCatFile(const std::string &path, int fd) {
  fflush(stdout);
  int saved = dup(1);
  dup2(fd, 1);
  auto start = std::chrono::steady_clock::now();
  catFile(path.c_str(), 0);
  double seconds = secondsSince(start);
  dup2(saved, 1);
  close(saved);
  return seconds;
}

// The CRC-32 of what catFile writes, read back through a pipe.
uLong catFileCrc(const std::string &path, uint64_t *bytes) {
  int ends[2];
  if (pipe(ends) != 0) fail("pipe");
  uLong crc = crc32(0, nullptr, 0);
  *bytes = 0;
  std::thread reader([&] {
    std::vector<uint8_t> buffer(1 << 16);
    ssize_t got;
    while ((got = read(ends[0], buffer.data(), buffer.size())) > 0) {
      crc = crc32(crc, buffer.data(), static_cast<uInt>(got));
      *bytes += static_cast<uint64_t>(got);
    }
  });
  timedCatFile(path, ends[1]);
  close(ends[1]);
  reader.join();
  close(ends[0]);
  return crc;
}

}  // namespace

int main(int argc, char **argv) {
  uint64_t sizeMiB = argc > 1 ? strtoull(argv[1], nullptr, 10) : 256;
  int repetitions = argc > 2 ? atoi(argv[2]) : 3;
  if (sizeMiB == 0 || repetitions < 1) {
    fprintf(stderr, "usage: %s [size-MiB] [repetitions]\n", argv[0]);
    return 2;
  }
  const uint64_t size = sizeMiB << 20;
  const char *root = getenv("PLZC_TEST_DIR");
  std::string pattern = std::string(root && *root ? root : "/dev/shm") + "/plzc-bench-XXXXXX";
  std::vector<char> dirName(pattern.begin(), pattern.end());
  dirName.push_back('\0');
  if (!mkdtemp(dirName.data())) fail("mkdtemp");
  std::string path = std::string(dirName.data()) + "/large.log";

  // The file, streamed, with the CRC of its data.
  uLong dataCrc = crc32(0, nullptr, 0);
  {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (fd < 0) fail("open");
    LogText text;
    for (uint64_t written = 0; written < size;) {
      std::string block = text.next(static_cast<size_t>(std::min<uint64_t>(1 << 20, size - written)));
      dataCrc = crc32(dataCrc, reinterpret_cast<const Bytef *>(block.data()), static_cast<uInt>(block.size()));
      if (write(fd, block.data(), block.size()) != static_cast<ssize_t>(block.size())) fail("write");
      written += block.size();
    }
    close(fd);
  }

  CompressorContext *ctx = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, true);
  if (!ctx) fail("initCompressor");
  auto start = std::chrono::steady_clock::now();
  int compressed = compressFile(ctx, path.c_str(), nullptr);
  double compressSeconds = secondsSince(start);
  freeCompressor(ctx);
  DiskHeader header{};
  if (compressed != 0 ||
      platform::getxattr(path.c_str(), kDecmpfsXattrName, &header, sizeof header, 0, 0) != sizeof header ||
      header.compressionType != 4) {
    fprintf(stderr, "catFileBench: the file was not compressed as type 4\n");
    return 1;
  }

  // The fork, read once; the baseline works on it in memory.
  ssize_t forkSize = platform::getxattr(path.c_str(), kResourceForkXattrName, nullptr, 0, 0, 0);
  if (forkSize < 0) fail("getxattr");
  std::vector<uint8_t> fork(static_cast<size_t>(forkSize));
  if (platform::getxattr(path.c_str(), kResourceForkXattrName, fork.data(), fork.size(), 0, 0) != forkSize)
    fail("getxattr");
  uint32_t count = loadLE32(&fork[kChunkCountPosition]);
  std::vector<Chunk> chunks;
  for (uint32_t i = 0; i < count; i++) {
    const uint8_t *entry = &fork[kChunkCountPosition + 4 + 8 * static_cast<size_t>(i)];
    chunks.push_back({&fork[kChunkCountPosition + loadLE32(entry)], loadLE32(entry + 4)});
  }

  // Both sides must produce the file's data.
  uLong baselineCrc = crc32(0, nullptr, 0);
  uint64_t catBytes = 0;
  if (inflateAll(chunks, &baselineCrc) != size || baselineCrc != dataCrc) {
    fprintf(stderr, "catFileBench: the baseline did not produce the data\n");
    return 1;
  }
  if (catFileCrc(path, &catBytes) != dataCrc || catBytes != size) {
    fprintf(stderr, "catFileBench: catFile did not produce the data\n");
    return 1;
  }

  int devNull = open("/dev/null", O_WRONLY);
  if (devNull < 0) fail("open /dev/null");
  double bestBaseline = 1e30, bestCat = 1e30;
  for (int run = 0; run < repetitions; run++) {
    start = std::chrono::steady_clock::now();
    inflateAll(chunks, nullptr);
    bestBaseline = std::min(bestBaseline, secondsSince(start));
    bestCat = std::min(bestCat, timedCatFile(path, devNull));
  }
  close(devNull);

  double baselineRate = static_cast<double>(size) / 1e6 / bestBaseline;
  double catRate = static_cast<double>(size) / 1e6 / bestCat;
  double ratio = catRate / baselineRate;
  printf("catFileBench: %u cores\n", std::thread::hardware_concurrency());
  printf("  file       %llu bytes (%llu MiB) of log text, type 4, fork %lld bytes (%.1f%%), %u chunks\n",
         static_cast<unsigned long long>(size), static_cast<unsigned long long>(sizeMiB),
         static_cast<long long>(forkSize), 100.0 * static_cast<double>(forkSize) / static_cast<double>(size), count);
  printf("  compress   %.2f s (compressFile, level 5)\n", compressSeconds);
  printf("  baseline   %8.1f MB/s  zlib inflate of the chunks in memory, one thread (best of %d)\n", baselineRate,
         repetitions);
  printf("  catFile    %8.1f MB/s  to /dev/null (best of %d)\n", catRate, repetitions);
  printf("  ratio      %.2f (engine %s, target %.1f: %s)\n", ratio, chunkEngineName(currentChunkEngine()),
         targetRatio(), ratio >= targetRatio() ? "met" : "NOT met");

  unlink(path.c_str());
  rmdir(dirName.data());
  return 0;
}
