// Fuzz target: the attribute layer's own bookkeeping as it may be found on disk
// (Platform/ExtendedAttributes): plain values "user.N", index records "user.plzc#N#i" and
// segments "user.plzc#N#<generation>.<number>", in any combination and with any contents, as an
// interrupted writer, another tool or a damaged file system may leave them. The target writes
// such a layout onto a file on /dev/shm, then reads, writes, replaces, removes and lists values
// through the layer, and decodes the file as the library's readers do.
//
// Whatever the layout, the layer must keep its own promises: a value written reads back as
// written (and, once a value is known, every read agrees with it), a removed value is gone
// with all its reserved names, a size query agrees with a read, and no listed name is reserved.
//
// Input: u8 count (modulo 9) of raw attributes, each a u8 kind and its name's parts (rawName),
// a u32 value length (modulo 65537) and the value; then operations until the input ends, each
// a u8 (low four bits: the operation, the next bits: which value) and its arguments (run).
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "Common/FileHandle.h"
#include "CompressedForm.h"
#include "FuzzSupport.h"
#include "Libraries/CompressData/DiskHeader.h"
#include "Platform/ExtendedAttributes.h"
#include "Plenzo.h"

using namespace plzcfuzz;

namespace {

const char *const kValueNames[] = {PLZC_RESOURCE_FORK_NAME, PLZC_DECMPFS_NAME, "x"};
constexpr size_t kValueCount = sizeof kValueNames / sizeof kValueNames[0];
constexpr uint32_t kReadLimit = 262144;
constexpr uint32_t kLinuxValueLimit = 65536;
// Values the target follows byte for byte stay below this size.
constexpr uint64_t kModelLimit = 1 << 20;

// Where reads land: one buffer for the process, so that no read pays for a fresh allocation. It
// holds the longest value a replacement writes (8 copies of a piece).
constexpr uint32_t kReadBufferSize = 1 << 20;
uint8_t *readBuffer() {
  static Bytes buffer(kReadBufferSize);
  return buffer.data();
}

enum RawKind : uint8_t { kPlain = 0, kIndex = 1, kSegment = 2, kOtherName = 3 };
enum Operation : uint8_t { kSize, kRead, kWrite, kReplace, kRemove, kList, kDecode, kOperationCount };

bool isFork(const char *name) { return strcmp(name, PLZC_RESOURCE_FORK_NAME) == 0; }

std::string reservedStem(const char *name) { return std::string(platform::kReservedLinuxPrefix) + name + "#"; }

// The Linux name of one raw attribute.
std::string rawName(uint8_t kind, InputReader &input) {
  const char *value = kValueNames[(kind >> 2) % kValueCount];
  switch (kind & 3) {
    case kPlain:
      return std::string("user.") + value;
    case kIndex:
      return reservedStem(value) + "i";
    case kSegment: {
      uint32_t generation = input.u32();
      unsigned number = input.u8();
      char suffix[40];
      snprintf(suffix, sizeof suffix, "%x.%x", generation, number);
      return reservedStem(value) + suffix;
    }
    default: {
      Bytes name = input.piece();
      std::string text(name.begin(), name.end());
      return "user." + text.substr(0, text.find('\0'));
    }
  }
}

// What the target knows of a value: nothing (as laid out raw), or, once it has been replaced or
// removed, its exact bytes or that it does not exist.
struct Model {
  bool known = false;
  bool exists = false;
  Bytes value;
};

class Session {
 public:
  explicit Session(std::string path) : path_(std::move(path)) {}

  void setRaw(const std::string &name, const Bytes &value) {
    // Linux may refuse a name or a value; the layout is then what it could hold.
    ::setxattr(path_.c_str(), name.c_str(), value.data(), value.size(), 0);
  }

  void run(uint8_t code, InputReader &input) {
    size_t which = (code >> 4) % kValueCount;
    const char *name = kValueNames[which];
    Model &model = models_[which];
    switch ((code & 15) % kOperationCount) {
      case kSize:
        checkSize(name, model);
        break;
      case kRead: {
        uint32_t position = isFork(name) ? input.u32() : 0;
        read(name, model, position, input.u32() % (kReadLimit + 1));
        break;
      }
      case kWrite: {
        uint32_t position = isFork(name) ? input.u32() : 0;
        write(name, model, position, input.piece());
        break;
      }
      case kReplace: {
        Bytes unit = input.piece();
        Bytes value;
        for (int copies = input.u8() % 8 + 1; copies > 0; copies--) value.insert(value.end(), unit.begin(), unit.end());
        replace(name, model, value);
        break;
      }
      case kRemove:
        remove(name, model);
        break;
      case kList:
        list();
        break;
      case kDecode:
        decode();
        break;
    }
  }

 private:
  // A size query answers the value's length, and a read of that many bytes gets them all.
  void checkSize(const char *name, const Model &model) {
    ssize_t size = platform::getxattr(path_.c_str(), name, nullptr, 0, 0, 0);
    if (size < 0) {
      FUZZ_CHECK(!model.known || !model.exists, "size of %s failed: %s", name, strerror(errno));
      return;
    }
    FUZZ_CHECK(!model.known || (model.exists && static_cast<size_t>(size) == model.value.size()),
               "size of %s is %zd, known %zu", name, size, model.value.size());
    if (size > static_cast<ssize_t>(kReadLimit) || size == 0) return;
    ssize_t got = platform::getxattr(path_.c_str(), name, readBuffer(), static_cast<size_t>(size), 0, 0);
    FUZZ_CHECK(got == size || (got < 0 && errno == EIO), "read of %s after a size of %zd gave %zd (%s)", name, size,
               got, strerror(errno));
  }

  void read(const char *name, const Model &model, uint32_t position, uint32_t length) {
    if (length == 0) return;  // no buffer: that is a size query
    length = std::min(length, kReadBufferSize);
    const uint8_t *value = readBuffer();
    ssize_t got = platform::getxattr(path_.c_str(), name, readBuffer(), length, position, 0);
    FUZZ_CHECK(got <= static_cast<ssize_t>(length), "read of %u bytes of %s gave %zd", length, name, got);
    if (!model.known) return;
    if (!model.exists) {
      FUZZ_CHECK(got < 0 && errno == ENOATTR, "read of removed %s gave %zd (%s)", name, got, strerror(errno));
      return;
    }
    if (!isFork(name)) {
      // Read whole, into a buffer that must hold it.
      if (length < model.value.size()) {
        FUZZ_CHECK(got < 0 && errno == ERANGE, "read of %s into %u bytes gave %zd", name, length, got);
      } else {
        FUZZ_CHECK(got == static_cast<ssize_t>(model.value.size()) &&
                       std::equal(model.value.begin(), model.value.end(), value),
                   "%s read back wrong", name);
      }
      return;
    }
    size_t from = std::min<size_t>(position, model.value.size());
    size_t count = std::min<size_t>(length, model.value.size() - from);
    FUZZ_CHECK(got == static_cast<ssize_t>(count) &&
                   std::equal(value, value + count, model.value.begin() + static_cast<ptrdiff_t>(from)),
               "read of %u bytes at %u of %s gave %zd, known %zu bytes", length, position, name, got,
               model.value.size());
  }

  void write(const char *name, Model &model, uint32_t position, const Bytes &bytes) {
    // On /dev/shm nothing but the layer itself can make a write of these sizes fail.
    FUZZ_CHECK(platform::setxattr(path_.c_str(), name, bytes.data(), bytes.size(), position, 0) == 0,
               "write of %zu bytes at %u of %s: %s", bytes.size(), position, name, strerror(errno));
    if (isFork(name)) {
      if (position + bytes.size() > kModelLimit) model.known = false;
      if (model.known) {
        if (!model.exists) model.value.clear();
        model.exists = true;
        if (model.value.size() < position + bytes.size()) model.value.resize(position + bytes.size(), 0);
        std::copy(bytes.begin(), bytes.end(), model.value.begin() + position);
      }
      // Known or not, the bytes just written read back (a read of none would be a size query).
      Bytes back(bytes.size());
      ssize_t got = bytes.empty() ? 0 : platform::getxattr(path_.c_str(), name, back.data(), back.size(), position, 0);
      FUZZ_CHECK(got == static_cast<ssize_t>(bytes.size()) && back == bytes,
                 "%zu bytes written at %u of %s read back as %zd others", bytes.size(), position, name, got);
    } else {
      model = Model{true, true, bytes};
    }
    read(name, model, position, static_cast<uint32_t>(bytes.size()));
  }

  void replace(const char *name, Model &model, const Bytes &value) {
    // A fork is replaced as a whole by removing it first; any other value by one set.
    if (isFork(name)) remove(name, model);
    write(name, model, 0, value);
    if (model.known) read(name, model, 0, static_cast<uint32_t>(value.size()) + 1);
  }

  void remove(const char *name, Model &model) {
    int result = platform::removexattr(path_.c_str(), name, 0);
    FUZZ_CHECK(result == 0 || (errno == ENOATTR && (!model.known || !model.exists)), "remove of %s: %s", name,
               strerror(errno));
    model = Model{true, false, {}};
    // Gone with every reserved name of its own: its index and any segment of any generation.
    std::string stem = reservedStem(name);
    for (const std::string &linuxName : linuxNames()) {
      FUZZ_CHECK(linuxName != std::string("user.") + name && linuxName != stem + "i", "%s left after removing %s",
                 linuxName.c_str(), name);
      if (linuxName.compare(0, stem.size(), stem) != 0) continue;
      std::string rest = linuxName.substr(stem.size());
      size_t dot = rest.find('.');
      bool segment = dot != std::string::npos && dot > 0 && dot + 1 < rest.size() &&
                     rest.find_first_not_of("0123456789abcdefABCDEF") == dot &&
                     rest.find_first_not_of("0123456789abcdefABCDEF", dot + 1) == std::string::npos;
      FUZZ_CHECK(!segment, "segment %s left after removing %s", linuxName.c_str(), name);
    }
  }

  // Every listed name is a name the caller can use: not reserved, and answering a size query
  // (or reporting a damaged record).
  void list() {
    ssize_t size = platform::listxattr(path_.c_str(), nullptr, 0, 0);
    if (size < 0) return;
    Bytes names(static_cast<size_t>(size) + 1);
    ssize_t got = platform::listxattr(path_.c_str(), reinterpret_cast<char *>(names.data()), names.size(), 0);
    FUZZ_CHECK(got == size, "list of %zd bytes after a size of %zd", got, size);
    for (ssize_t at = 0; at < got;) {
      const char *name = reinterpret_cast<const char *>(names.data()) + at;
      at += static_cast<ssize_t>(strlen(name)) + 1;
      FUZZ_CHECK(strncmp(name, "plzc#", 5) != 0, "reserved name %s listed", name);
      ssize_t length = platform::getxattr(path_.c_str(), name, nullptr, 0, 0, 0);
      FUZZ_CHECK(length >= 0 || errno == EIO || errno == ENAMETOOLONG, "listed %s, whose size query fails: %s", name,
                 strerror(errno));
    }
  }

  // The file read as a compressed file, through a plain handle.
  void decode() {
    FileHandle *handle = openFile(path_.c_str(), path_.c_str(), O_RDONLY);
    FUZZ_CHECK(handle, "cannot open %s", path_.c_str());
    Bytes header(kMaxType3AttributeSize);
    ssize_t got = platform::getxattr(path_.c_str(), kDecmpfsXattrName, header.data(), header.size(), 0, 0);
    header.resize(got > 0 ? static_cast<size_t>(got) : 0);
    decodeAndCheck(handle, got > 0 ? &header : nullptr);
    handle->close(handle);
  }

  std::vector<std::string> linuxNames() {
    std::vector<std::string> names;
    ssize_t size = ::listxattr(path_.c_str(), nullptr, 0);
    if (size <= 0) return names;
    std::vector<char> buffer(static_cast<size_t>(size));
    size = ::listxattr(path_.c_str(), buffer.data(), buffer.size());
    for (ssize_t at = 0; at < size; at += static_cast<ssize_t>(names.back().size()) + 1)
      names.emplace_back(&buffer[static_cast<size_t>(at)]);
    return names;
  }

  std::string path_;
  Model models_[kValueCount];
};

// ---- Seeds: layouts the layer itself writes, and operations on them ----------------------------

// The raw attributes of the file at path, encoded as the input's first part.
Bytes layoutOf(const std::string &path) {
  std::vector<std::string> names;
  ssize_t size = ::listxattr(path.c_str(), nullptr, 0);
  std::vector<char> list(size > 0 ? static_cast<size_t>(size) : 0);
  size = size > 0 ? ::listxattr(path.c_str(), list.data(), list.size()) : 0;
  for (ssize_t at = 0; at < size; at += static_cast<ssize_t>(names.back().size()) + 1)
    names.emplace_back(&list[static_cast<size_t>(at)]);
  InputWriter out;
  out.u8(static_cast<uint8_t>(std::min<size_t>(names.size(), 8)));
  for (size_t i = 0; i < names.size() && i < 8; i++) {
    const std::string &linuxName = names[i];
    InputWriter name;
    uint8_t kind = kOtherName;
    for (size_t which = 0; which < kValueCount && kind == kOtherName; which++) {
      std::string stem = reservedStem(kValueNames[which]);
      unsigned generation = 0, number = 0;
      char end = 0;
      if (linuxName == std::string("user.") + kValueNames[which]) {
        kind = static_cast<uint8_t>(kPlain | which << 2);
      } else if (linuxName == stem + "i") {
        kind = static_cast<uint8_t>(kIndex | which << 2);
      } else if (linuxName.compare(0, stem.size(), stem) == 0 &&
                 sscanf(linuxName.c_str() + stem.size(), "%x.%x%c", &generation, &number, &end) == 2 && number < 256) {
        kind = static_cast<uint8_t>(kSegment | which << 2);
        name.u32(generation).u8(static_cast<uint8_t>(number));
      }
    }
    if (kind == kOtherName) name.piece(linuxName.substr(5));
    Bytes value(kLinuxValueLimit);
    ssize_t got = ::getxattr(path.c_str(), linuxName.c_str(), value.data(), value.size());
    value.resize(got > 0 ? static_cast<size_t>(got) : 0);
    out.u8(kind).bytes(name.data()).u32(static_cast<uint32_t>(value.size())).bytes(value);
  }
  return out.data();
}

// Operations, encoded as run reads them.
class Script {
 public:
  Script &size(size_t which) { return op(kSize, which); }
  Script &read(size_t which, uint32_t position, uint32_t length) {
    op(kRead, which);
    if (which == 0) out_.u32(position);
    out_.u32(length);
    return *this;
  }
  Script &write(size_t which, uint32_t position, const Bytes &bytes) {
    op(kWrite, which);
    if (which == 0) out_.u32(position);
    out_.piece(bytes);
    return *this;
  }
  Script &replace(size_t which, const Bytes &unit, uint8_t copies) {
    op(kReplace, which).out_.piece(unit).u8(static_cast<uint8_t>(copies - 1));
    return *this;
  }
  Script &remove(size_t which) { return op(kRemove, which); }
  Script &list() { return op(kList, 0); }
  Script &decode() { return op(kDecode, 0); }
  const Bytes &data() const { return out_.data(); }

 private:
  Script &op(Operation operation, size_t which) {
    out_.u8(static_cast<uint8_t>(operation | which << 4));
    return *this;
  }
  InputWriter out_;
};

Bytes seed(const Bytes &layout, const Script &script) {
  Bytes input = layout;
  input.insert(input.end(), script.data().begin(), script.data().end());
  return input;
}

void writeSeeds(SeedSink &seeds) {
  std::string path = scratchDir() + "/seed";
  auto fresh = [&] {
    unlink(path.c_str());
    FUZZ_CHECK(writeWholeFile(path, {}), "cannot create %s", path.c_str());
  };
  fresh();
  Bytes small = randomBytes(100, 1);
  platform::setxattr(path.c_str(), PLZC_RESOURCE_FORK_NAME, small.data(), small.size(), 0, 0);
  seeds.add(
      "plain-fork",
      seed(layoutOf(path), Script().read(0, 50, 100).write(0, 80, {'h', 'e', 'y'}).size(0).list().remove(0).size(0)));

  fresh();
  Bytes segmented = randomBytes(70000, 2);
  platform::setxattr(path.c_str(), PLZC_RESOURCE_FORK_NAME, segmented.data(), segmented.size(), 0, 0);
  platform::setxattr(path.c_str(), "x", small.data(), 10, 0, 0);
  seeds.add("segmented-fork", seed(layoutOf(path), Script()
                                                       .read(0, 65530, 20)
                                                       .write(0, 140000, randomBytes(10, 3))
                                                       .read(0, 69990, 100)
                                                       .replace(1, randomBytes(20000, 4), 8)
                                                       .read(1, 0, 200000)
                                                       .list()
                                                       .remove(0)
                                                       .remove(1)
                                                       .list()));

  // Files compressed in place by the library: a fork in one Linux attribute, and one in segments.
  Bytes mixed = randomBytes(70000, 5);
  Bytes text = compressibleBytes(300000, 6);
  mixed.insert(mixed.end(), text.begin(), text.end());
  const struct {
    const char *name;
    Bytes contents;
  } kCompressed[] = {{"type3-file", compressibleBytes(20000, 7)},
                     {"type4-file", compressibleBytes(300000, 8)},
                     {"type4-segmented-fork", mixed}};
  for (const auto &file : kCompressed) {
    fresh();
    FUZZ_CHECK(writeWholeFile(path, file.contents), "cannot write %s", path.c_str());
    CompressorContext *context = initCompressor("3,4", nullptr, nullptr, nullptr, false, 5, false);
    FUZZ_CHECK(context && compressFile(context, path.c_str(), nullptr) == 0, "cannot compress %s", file.name);
    freeCompressor(context);
    seeds.add(file.name, seed(layoutOf(path), Script().decode().size(0).read(0, 260, 16).list()));
  }
  unlink(path.c_str());
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  std::string path = scratchDir() + "/file";
  unlink(path.c_str());
  int fd = open(path.c_str(), O_CREAT | O_WRONLY | O_TRUNC | O_CLOEXEC, 0644);
  FUZZ_CHECK(fd >= 0, "cannot create %s: %s", path.c_str(), strerror(errno));
  close(fd);

  InputReader input(data, size);
  Session session(path);
  for (int count = input.u8() % 9; count > 0; count--) {
    uint8_t kind = input.u8();
    std::string name = rawName(kind, input);
    session.setRaw(name, input.bytes(input.u32() % (kLinuxValueLimit + 1)));
  }
  while (input.remaining() > 0) session.run(input.u8(), input);
  unlink(path.c_str());
  return 0;
}
