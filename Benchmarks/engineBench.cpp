// The chunking engine against raw zlib on the same 64 KiB chunks, one thread.
//
//   engineBench [DIR] [size-MiB] [repetitions]
//
// Data: the regular files under DIR read into memory (a corpus made by the project's corpus
// generator, say), or, without DIR, generated mixed data (log lines, code-like text, structured
// binary, random bytes) of size-MiB (default 128). Times, best of the repetitions:
//   - compression: chunkingCompressor over a memory handle, every chunk emitted into one
//     buffer, against deflateReset plus one deflate per chunk at the same level (5);
//   - decompression: chunkingDecompressor of the whole data from those chunks, in 128 KiB
//     pieces as the readers ask, against inflateReset plus one inflate per chunk.
// Every chunk is checked to decode to its data once, outside the timed runs. Prints MB/s
// (10^6 bytes of logical data per second) and the ratios; targets 0.95 and 0.9.
#include <dirent.h>
#include <sys/stat.h>
#include <zlib.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Common/commonUtils.h"

namespace {

constexpr uint32_t kChunkSize = 65536;
constexpr int kLevel = 5;

double secondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

void readTree(const std::string &dir, std::vector<uint8_t> *data) {
  DIR *d = opendir(dir.c_str());
  if (!d) return;
  while (dirent *entry = readdir(d)) {
    std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    std::string path = dir + "/" + name;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) continue;
    if (S_ISDIR(st.st_mode)) {
      readTree(path, data);
    } else if (S_ISREG(st.st_mode)) {
      std::ifstream in(path, std::ios::binary);
      data->insert(data->end(), std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    }
  }
  closedir(d);
}

std::vector<uint8_t> generated(size_t size) {
  std::vector<uint8_t> data;
  data.reserve(size + 256);
  std::mt19937 engine(1);
  auto random = [&engine] { return static_cast<unsigned>(engine()); };
  const char *words[] = {"request", "handler", "status", "return", "buffer", "offset", "value", "client",
                         "error", "static", "const", "struct", "window", "stream", "config", "ready"};
  while (data.size() < size) {
    switch (random() % 4) {
      case 0:  // log lines
        for (int i = 0; i < 200; i++) {
          char line[160];
          int n = snprintf(line, sizeof line, "2026-11-%02u 12:%02u:%02u [%s] %s %s id=%u took %u ms\n",
                           random() % 28 + 1, random() % 60, random() % 60, words[random() % 16],
                           words[random() % 16], words[random() % 16], random() % 100000, random() % 900);
          data.insert(data.end(), line, line + n);
        }
        break;
      case 1:  // code-like text
        for (int i = 0; i < 200; i++) {
          char line[160];
          int n = snprintf(line, sizeof line, "  %s %s_%u = %s(%s, %u);\n", words[random() % 16],
                           words[random() % 16], random() % 50, words[random() % 16], words[random() % 16],
                           random() % 4096);
          data.insert(data.end(), line, line + n);
        }
        break;
      case 2:  // structured binary: records with small integers
        for (int i = 0; i < 4096; i++) {
          uint32_t record[4] = {static_cast<uint32_t>(i), random() % 256, random() % 65536, 0x1000u + i * 16};
          const uint8_t *bytes = reinterpret_cast<const uint8_t *>(record);
          data.insert(data.end(), bytes, bytes + sizeof record);
        }
        break;
      default:  // already compressed
        for (int i = 0; i < 16384; i++) data.push_back(static_cast<uint8_t>(random()));
    }
  }
  data.resize(size);
  return data;
}

struct Memory {
  FileHandle handle{};
  const std::vector<uint8_t> *data;
};

int64_t memoryPread(FileHandle *fh, void *buffer, int64_t count, int64_t offset) {
  auto *memory = static_cast<Memory *>(fh->priv);
  int64_t n = std::max<int64_t>(0, std::min<int64_t>(count, static_cast<int64_t>(memory->data->size()) - offset));
  memcpy(buffer, memory->data->data() + offset, static_cast<size_t>(n));
  return n;
}
int64_t memorySize(FileHandle *fh) { return static_cast<int64_t>(static_cast<Memory *>(fh->priv)->data->size()); }

// Stored chunks, back to back, with their offsets.
struct Chunks {
  std::vector<uint8_t> bytes;
  std::vector<uint64_t> offsets{0};
};

int emitChunk(void *state, uint64_t, uint64_t, uint8_t *buffer, uint32_t length) {
  auto *chunks = static_cast<Chunks *>(state);
  chunks->bytes.insert(chunks->bytes.end(), buffer, buffer + length);
  chunks->offsets.push_back(chunks->bytes.size());
  return 0;
}

uint32_t supplyChunk(void *state, uint64_t index, uint8_t *buffer, uint32_t capacity) {
  auto *chunks = static_cast<Chunks *>(state);
  if (index + 1 >= chunks->offsets.size()) return 0;
  uint64_t length = chunks->offsets[index + 1] - chunks->offsets[index];
  if (length > capacity) return kChunkError;
  memcpy(buffer, chunks->bytes.data() + chunks->offsets[index], length);
  return static_cast<uint32_t>(length);
}

}  // namespace

int main(int argc, char **argv) {
  std::string dir = argc > 1 && argv[1][0] && !isdigit(static_cast<unsigned char>(argv[1][0])) ? argv[1] : "";
  int next = dir.empty() ? 1 : 2;
  size_t sizeMiB = argc > next ? strtoul(argv[next], nullptr, 10) : 128;
  int repetitions = argc > next + 1 ? atoi(argv[next + 1]) : 3;
  std::vector<uint8_t> data;
  if (!dir.empty()) readTree(dir, &data);
  if (data.empty()) data = generated(sizeMiB << 20);
  double megabytes = static_cast<double>(data.size()) / 1e6;
  size_t chunkCount = (data.size() + kChunkSize - 1) / kChunkSize;

  Memory memory;
  memory.data = &data;
  memory.handle.name = memory.handle.path = const_cast<char *>("memory");
  memory.handle.pread = memoryPread;
  memory.handle.size = memorySize;
  memory.handle.priv = &memory;

  // Compression.
  double engineBest = 1e9, zlibBest = 1e9;
  Chunks chunks;
  std::vector<uint8_t> out(kChunkSize);
  size_t rawStored = 0;
  for (int r = 0; r < repetitions; r++) {
    Chunks run;
    run.bytes.reserve(data.size() + chunkCount);
    auto start = std::chrono::steady_clock::now();
    if (chunkingCompressor(&memory.handle, 0, kChunkSize, 0, 0, 0, &run, emitChunk, supplyChunk, kLevel) != 0) {
      fprintf(stderr, "engine compression failed\n");
      return 1;
    }
    engineBest = std::min(engineBest, secondsSince(start));
    chunks = std::move(run);

    // The baseline keeps its chunks too, as the engine's emit callback does.
    std::vector<uint8_t> rawChunks;
    rawChunks.reserve(data.size() + chunkCount);
    z_stream stream{};
    deflateInit(&stream, kLevel);
    rawStored = 0;
    start = std::chrono::steady_clock::now();
    for (size_t offset = 0; offset < data.size(); offset += kChunkSize) {
      size_t n = std::min<size_t>(kChunkSize, data.size() - offset);
      deflateReset(&stream);
      stream.next_in = const_cast<uint8_t *>(data.data() + offset);
      stream.avail_in = static_cast<uInt>(n);
      stream.next_out = out.data();
      stream.avail_out = static_cast<uInt>(n);
      int result = deflate(&stream, Z_FINISH);
      if (result == Z_STREAM_END) {
        rawChunks.insert(rawChunks.end(), out.data(), out.data() + (n - stream.avail_out));
      } else {
        rawChunks.push_back(kStoredChunkMarker);
        rawChunks.insert(rawChunks.end(), data.data() + offset, data.data() + offset + n);
      }
    }
    zlibBest = std::min(zlibBest, secondsSince(start));
    rawStored = rawChunks.size();
    deflateEnd(&stream);
  }

  // Every chunk decodes to its data.
  std::vector<uint8_t> back(data.size());
  struct iovec whole = {back.data(), back.size()};
  if (chunkingDecompressor(0, back.size(), 1, &whole, kChunkSize, 0, 0, &chunks, supplyChunk) !=
          static_cast<int64_t>(data.size()) ||
      back != data) {
    fprintf(stderr, "engine chunks do not decode to the data\n");
    return 1;
  }

  // Decompression, in the 128 KiB pieces the readers use.
  double engineReadBest = 1e9, inflateBest = 1e9;
  std::vector<uint8_t> piece(131072);
  for (int r = 0; r < repetitions; r++) {
    auto start = std::chrono::steady_clock::now();
    for (size_t offset = 0; offset < data.size(); offset += piece.size()) {
      struct iovec vector = {piece.data(), std::min(piece.size(), data.size() - offset)};
      chunkingDecompressor(static_cast<int64_t>(offset), vector.iov_len, 1, &vector, kChunkSize, 0, 0, &chunks,
                           supplyChunk);
    }
    engineReadBest = std::min(engineReadBest, secondsSince(start));

    z_stream stream{};
    inflateInit(&stream);
    start = std::chrono::steady_clock::now();
    for (size_t index = 0; index < chunkCount; index++) {
      const uint8_t *chunk = chunks.bytes.data() + chunks.offsets[index];
      size_t length = chunks.offsets[index + 1] - chunks.offsets[index];
      if (chunk[0] == kStoredChunkMarker) {
        memcpy(out.data(), chunk + 1, length - 1);
        continue;
      }
      inflateReset(&stream);
      stream.next_in = const_cast<uint8_t *>(chunk);
      stream.avail_in = static_cast<uInt>(length);
      stream.next_out = out.data();
      stream.avail_out = kChunkSize;
      inflate(&stream, Z_FINISH);
    }
    inflateBest = std::min(inflateBest, secondsSince(start));
    inflateEnd(&stream);
  }

  printf("data: %.1f MB in %zu chunks of 64 KiB (%s), level %d, %u cores, best of %d\n", megabytes, chunkCount,
         dir.empty() ? "generated" : dir.c_str(), kLevel, std::thread::hardware_concurrency(), repetitions);
  printf("stored/logical: engine %.3f, raw zlib %.3f\n", static_cast<double>(chunks.bytes.size()) / data.size(),
         static_cast<double>(rawStored) / data.size());
  printf("compress:   engine %7.1f MB/s   raw zlib %7.1f MB/s   ratio %.3f (target 0.95)\n", megabytes / engineBest,
         megabytes / zlibBest, zlibBest / engineBest);
  printf("decompress: engine %7.1f MB/s   raw inflate %7.1f MB/s   ratio %.3f (target 0.90)\n",
         megabytes / engineReadBest, megabytes / inflateBest, inflateBest / engineReadBest);
  return 0;
}
