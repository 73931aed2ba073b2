#include "Corpus.h"

#include <fcntl.h>
#include <md5.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <map>

namespace plzc {

namespace {

// splitmix64: fast, good enough for test data, the same everywhere.
class Random {
 public:
  explicit Random(uint64_t seed) : state_(seed) {}
  uint64_t next() {
    uint64_t z = (state_ += 0x9E3779B97F4A7C15ull);
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ull;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBull;
    return z ^ (z >> 31);
  }
  uint64_t below(uint64_t bound) { return bound ? next() % bound : 0; }
  double unit() { return static_cast<double>(next() >> 11) / 9007199254740992.0; }
  // Uniform in the logarithm: as many files of 100 to 1000 bytes as of 1000 to 10000.
  uint64_t logUniform(uint64_t low, uint64_t high) {
    return static_cast<uint64_t>(std::exp(std::log(low) + unit() * (std::log(high) - std::log(low))));
  }
  // A few words are common, most are rare, as in real text.
  size_t skewed(size_t count) { return static_cast<size_t>(static_cast<double>(count) * std::pow(unit(), 3.0)); }
  void fill(uint8_t *bytes, size_t count) {
    for (size_t i = 0; i < count; i += 8) {
      uint64_t value = next();
      memcpy(bytes + i, &value, std::min<size_t>(8, count - i));
    }
  }

 private:
  uint64_t state_;
};

const char *const kWords[] = {
    "the",    "of",     "and",    "to",      "in",     "is",      "for",    "on",      "with",   "as",
    "buffer", "stream", "chunk",  "file",    "path",   "size",    "offset", "length",  "count",  "index",
    "value",  "result", "error",  "status",  "flags",  "header",  "table",  "entry",   "node",   "list",
    "queue",  "lock",   "thread", "worker",  "pool",   "task",    "job",    "request", "reply",  "handle",
    "state",  "cache",  "block",  "page",    "record", "field",   "key",    "name",    "type",   "mode",
    "read",   "write",  "open",   "close",   "seek",   "flush",   "sync",   "alloc",   "free",   "init",
    "check",  "verify", "update", "create",  "delete", "volume",  "device", "mount",   "inode",  "session",
    "server", "client", "socket", "message", "event",  "timer",   "retry",  "signal",  "notify", "timeout",
};
constexpr size_t kWordCount = sizeof kWords / sizeof kWords[0];
const char *const kLevels[] = {"INFO", "INFO", "INFO", "INFO", "DEBUG", "DEBUG", "WARN", "ERROR"};
const char *const kComponents[] = {"io", "net", "db", "auth", "sched", "store", "cache", "api", "fs", "sync"};

enum class Kind { Source, Log, Prose, Binary, Random };

struct KindInfo {
  Kind kind;
  double share;  // of the bytes of the ordinary files
  const char *const *dirs;
  const char *const *extensions;
};

const char *const kSourceDirs[] = {"src", "src/net", "src/store", "src/util", "include", "tests", nullptr};
const char *const kLogDirs[] = {"logs", "logs/2026-03", "logs/2026-04", "var/log/api", nullptr};
const char *const kProseDirs[] = {"docs", "docs/design", "docs/notes", nullptr};
const char *const kBinaryDirs[] = {"build/obj", "build/lib", "data/tables", nullptr};
const char *const kRandomDirs[] = {"assets/images", "assets/archives", "data/blobs", nullptr};
const char *const kSourceExt[] = {".c", ".h", ".cpp", ".py", ".js", nullptr};
const char *const kLogExt[] = {".log", ".log", ".txt", nullptr};
const char *const kProseExt[] = {".md", ".txt", ".html", nullptr};
const char *const kBinaryExt[] = {".o", ".so", ".bin", ".db", nullptr};
const char *const kRandomExt[] = {".jpg", ".png", ".gz", ".zip", nullptr};

const KindInfo kKinds[] = {
    {Kind::Source, 0.25, kSourceDirs, kSourceExt}, {Kind::Log, 0.25, kLogDirs, kLogExt},
    {Kind::Prose, 0.15, kProseDirs, kProseExt},    {Kind::Binary, 0.15, kBinaryDirs, kBinaryExt},
    {Kind::Random, 0.20, kRandomDirs, kRandomExt},
};

size_t countOf(const char *const *list) {
  size_t n = 0;
  while (list[n]) n++;
  return n;
}

// Pools of typical content; files are stitched from slices of them, so that each file is
// different but compresses like real files of its kind.
struct Pools {
  std::string source, prose, binary;
};

std::string makeSourcePool(Random &random, size_t size) {
  std::string pool;
  int depth = 0;
  char line[256];
  // Each function uses a few identifiers of its own.
  std::string locals[8];
  auto newFunction = [&] {
    for (auto &local : locals) local = std::string(kWords[random.skewed(kWordCount)]) + "_" + kWords[random.below(kWordCount)];
  };
  newFunction();
  auto v = [&] { return locals[random.below(8)].c_str(); };
  while (pool.size() < size) {
    if (depth == 0 && random.below(20) == 0) newFunction();
    std::string indent(static_cast<size_t>(depth) * 4, ' ');
    uint64_t r = random.below(100);
    if (r < 8 && depth < 4) {
      snprintf(line, sizeof line, "%sif (%s < %u) {\n", indent.c_str(), v(), static_cast<unsigned>(random.below(64)));
      depth++;
    } else if (r < 16 && depth > 0) {
      depth--;
      snprintf(line, sizeof line, "%s}\n", std::string(static_cast<size_t>(depth) * 4, ' ').c_str());
    } else if (r < 28) {
      snprintf(line, sizeof line, "%s// %s the %s %s before the %s\n", indent.c_str(), kWords[random.skewed(kWordCount)],
               kWords[random.skewed(kWordCount)], kWords[random.skewed(kWordCount)], kWords[random.skewed(kWordCount)]);
    } else if (r < 60) {
      snprintf(line, sizeof line, "%s%s = %s(%s, %s, %u);\n", indent.c_str(), v(), kWords[random.skewed(kWordCount)],
               v(), v(), static_cast<unsigned>(random.below(4096)));
    } else if (r < 85) {
      snprintf(line, sizeof line, "%ssize_t %s = %s->%s_%s;\n", indent.c_str(), v(), v(),
               kWords[random.skewed(kWordCount)], kWords[random.skewed(kWordCount)]);
    } else {
      snprintf(line, sizeof line, "%sreturn %s + 0x%x;\n", indent.c_str(), v(), static_cast<unsigned>(random.below(65536)));
    }
    pool += line;
  }
  return pool;
}

std::string makeProsePool(Random &random, size_t size) {
  std::string pool;
  while (pool.size() < size) {
    size_t words = 6 + random.below(18);
    for (size_t i = 0; i < words; i++) {
      std::string word = kWords[random.skewed(kWordCount)];
      if (i == 0) word[0] = static_cast<char>(toupper(word[0]));
      pool += word;
      pool += i + 1 < words ? (random.below(12) == 0 ? ", " : " ") : ". ";
    }
    if (random.below(6) == 0) pool += "\n\n";
  }
  return pool;
}

std::string makeBinaryPool(Random &random, size_t size) {
  std::string pool;
  while (pool.size() < size) {
    uint64_t r = random.below(100);
    if (r < 45) {  // a table of records: small counters, flags and offsets
      uint32_t base = static_cast<uint32_t>(random.below(1 << 20)) << 8;
      for (int i = 0, n = 64 + static_cast<int>(random.below(512)); i < n; i++) {
        uint32_t record[4] = {base + static_cast<uint32_t>(i) * 16, static_cast<uint32_t>(random.below(256)),
                              static_cast<uint32_t>(random.skewed(16)), 0};
        pool.append(reinterpret_cast<const char *>(record), sizeof record);
      }
    } else if (r < 70) {  // a string table
      for (int i = 0, n = 20 + static_cast<int>(random.below(200)); i < n; i++) {
        pool += "_";
        pool += kWords[random.skewed(kWordCount)];
        pool += "_";
        pool += kWords[random.below(kWordCount)];
        pool.push_back('\0');
      }
    } else if (r < 85) {  // padding
      pool.append(static_cast<size_t>(64 + random.below(2048)), '\0');
    } else {  // code-like bytes over a small alphabet
      for (int i = 0, n = 256 + static_cast<int>(random.below(2048)); i < n; i++)
        pool.push_back(static_cast<char>(0x40 + random.skewed(48)));
    }
  }
  return pool;
}

// Slices of 4 to 64 KiB from random places of the pool, to make count bytes.
void stitch(Random &random, const std::string &pool, size_t count, std::vector<uint8_t> *out) {
  while (out->size() < count) {
    size_t piece = std::min<size_t>(count - out->size(), 4096 + random.below(61440));
    size_t at = random.below(pool.size() - piece);
    out->insert(out->end(), pool.begin() + static_cast<long>(at), pool.begin() + static_cast<long>(at + piece));
  }
}

void makeLog(Random &random, size_t count, std::vector<uint8_t> *out) {
  uint64_t millis = 1'790'000'000'000ull + random.below(1'000'000'000);
  char line[256];
  while (out->size() < count) {
    millis += 1 + random.below(1500);
    uint64_t seconds = millis / 1000 % 86400;
    int n = snprintf(line, sizeof line, "2026-03-%02u %02u:%02u:%02u.%03u %s [%s] %s %s %s %s id=%06x took %u ms\n",
                     static_cast<unsigned>(millis / 86'400'000 % 28 + 1), static_cast<unsigned>(seconds / 3600),
                     static_cast<unsigned>(seconds / 60 % 60), static_cast<unsigned>(seconds % 60),
                     static_cast<unsigned>(millis % 1000), kLevels[random.below(8)], kComponents[random.below(10)],
                     kWords[random.skewed(kWordCount)], kWords[random.skewed(kWordCount)],
                     kWords[random.skewed(kWordCount)], kWords[random.skewed(kWordCount)],
                     static_cast<unsigned>(random.below(1 << 24)), static_cast<unsigned>(random.below(200)));
    out->insert(out->end(), line, line + n);
  }
  out->resize(count);
}

void makeContent(Kind kind, size_t count, const char *extension, Random &random, const Pools &pools,
                 std::vector<uint8_t> *out) {
  out->clear();
  out->reserve(count);
  switch (kind) {
    case Kind::Source: stitch(random, pools.source, count, out); break;
    case Kind::Prose: stitch(random, pools.prose, count, out); break;
    case Kind::Binary: stitch(random, pools.binary, count, out); break;
    case Kind::Log: makeLog(random, count, out); break;
    case Kind::Random: {
      static const std::map<std::string, std::string> kMagic = {
          {".jpg", "\xff\xd8\xff\xe0"}, {".png", "\x89PNG\r\n\x1a\n"}, {".gz", "\x1f\x8b\x08"}, {".zip", "PK\x03\x04"}};
      out->resize(count);
      random.fill(out->data(), count);
      auto magic = kMagic.find(extension);
      if (magic != kMagic.end()) memcpy(out->data(), magic->second.data(), std::min(count, magic->second.size()));
      break;
    }
  }
  out->resize(count);
}

bool writeBytes(const std::string &path, const std::vector<uint8_t> &bytes, std::string *error) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  if (fd < 0) {
    *error = path + ": " + strerror(errno);
    return false;
  }
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t wrote = write(fd, bytes.data() + done, bytes.size() - done);
    if (wrote < 0 && errno == EINTR) continue;
    if (wrote <= 0) {
      *error = path + ": " + strerror(wrote < 0 ? errno : EIO);
      close(fd);
      return false;
    }
    done += static_cast<size_t>(wrote);
  }
  if (close(fd) != 0) {
    *error = path + ": " + strerror(errno);
    return false;
  }
  return true;
}

bool makeDirectories(const std::string &root, const std::string &relative, std::string *error) {
  std::string path = root;
  size_t start = 0;
  while (start <= relative.size()) {
    size_t slash = relative.find('/', start);
    if (slash == std::string::npos) slash = relative.size();
    path += "/" + relative.substr(start, slash - start);
    if (mkdir(path.c_str(), 0755) != 0 && errno != EEXIST) {
      *error = path + ": " + strerror(errno);
      return false;
    }
    start = slash + 1;
  }
  return true;
}

}  // namespace

bool generateCorpus(const std::string &dir, uint64_t totalBytes, uint64_t seed, std::vector<CorpusFile> *files,
                    CorpusStats *stats, std::string *error) {
  Random random(seed);
  Pools pools{makeSourcePool(random, 4 << 20), makeProsePool(random, 2 << 20), makeBinaryPool(random, 2 << 20)};
  for (const KindInfo &kind : kKinds)
    for (size_t i = 0; kind.dirs[i]; i++)
      if (!makeDirectories(dir, kind.dirs[i], error)) return false;
  if (!makeDirectories(dir, "shared", error)) return false;

  files->clear();
  *stats = CorpusStats{};
  std::vector<uint8_t> content;
  int serial = 0;
  auto addFile = [&](const KindInfo &kind, size_t size) {
    const char *extension = kind.extensions[random.below(countOf(kind.extensions))];
    std::string relative = std::string(kind.dirs[random.below(countOf(kind.dirs))]) + "/" +
                           kWords[random.below(kWordCount)] + "-" + std::to_string(serial++) + extension;
    makeContent(kind.kind, size, extension, random, pools, &content);
    if (!writeBytes(dir + "/" + relative, content, error)) return false;
    CorpusFile file;
    file.path = relative;
    file.size = size;
    MD5_CTX md5;
    MD5Init(&md5);
    MD5Update(&md5, content.data(), content.size());
    MD5Final(file.digest, &md5);
    files->push_back(file);
    stats->files++;
    stats->bytes += size;
    return true;
  };

  // Two large files: a long log and a large already-compressed archive.
  uint64_t bigLog = totalBytes / 8, bigArchive = totalBytes / 12;
  if (!addFile(kKinds[1], bigLog) || !addFile(kKinds[4], bigArchive)) return false;
  uint64_t budget = totalBytes - std::min(totalBytes, bigLog + bigArchive);
  // Then files of every kind by its share of the bytes: half tiny, most of the rest medium.
  uint64_t written = 0;
  while (written < budget) {
    double pick = random.unit(), sum = 0;
    const KindInfo *kind = &kKinds[0];
    for (const KindInfo &candidate : kKinds) {
      sum += candidate.share;
      kind = &candidate;
      if (pick < sum) break;
    }
    uint64_t sizeClass = random.below(100);
    uint64_t size = sizeClass < 50   ? random.logUniform(64, 4096)
                    : sizeClass < 92 ? random.logUniform(4096, 128 << 10)
                                     : random.logUniform(128 << 10, 2 << 20);
    size = std::min<uint64_t>(size, budget - written);
    if (size == 0) break;
    if (!addFile(*kind, static_cast<size_t>(size))) return false;
    written += size;
  }

  // Empty files.
  for (const char *name : {"build/obj/.keep", "logs/empty.log", "docs/TODO", "src/util/placeholder.h"}) {
    if (!writeBytes(dir + "/" + name, {}, error)) return false;
    CorpusFile file;
    file.path = name;
    MD5_CTX md5;
    MD5Init(&md5);
    MD5Final(file.digest, &md5);
    files->push_back(file);
    stats->files++;
  }

  // Hard links: second names, in another directory, for a few files of each size.
  size_t originals = files->size();
  for (int i = 0; i < 6; i++) {
    CorpusFile link = (*files)[random.below(originals)];
    if (link.size == 0) continue;
    std::string name = "shared/link-" + std::to_string(i) + "-" + link.path.substr(link.path.rfind('/') + 1);
    if (::link((dir + "/" + link.path).c_str(), (dir + "/" + name).c_str()) != 0) {
      *error = dir + "/" + name + ": " + strerror(errno);
      return false;
    }
    link.path = name;
    link.hardLink = true;
    files->push_back(link);
  }
  // A symbolic link, which the walk does not follow.
  if (symlink("../logs", (dir + "/shared/logs").c_str()) != 0) {
    *error = dir + "/shared/logs: " + strerror(errno);
    return false;
  }
  stats->paths = files->size();
  return true;
}

}  // namespace plzc
