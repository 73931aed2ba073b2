// Fuzz target: the options dictionary of a stream compressor queue and the rule arrays in it,
// as a caller hands them over: a queue is created from the options (Mach-O type list, override
// paths, switches), initialised as its first stream would (rules, types, level), asked about a
// set of paths, and finished.
//
// The settings file of the default compression level is read too, from a file of the input's
// first bytes.
//
// Input: u8 length (modulo 18) and the settings file's bytes, then an XML property list. A
// dictionary is the options; an array is taken as the rules, both the caller's and the system's.
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Common/CompressionRules.h"
#include "Common/MachOFilter.h"
#include "Common/StreamCompressor.h"
#include "FuzzSupport.h"
#include "Plenzo.h"

using namespace plzcfuzz;

namespace {

constexpr char kPrefix[] = "/Volumes/T";
constexpr size_t kMaxStrings = 16;

// Paths worth asking about: fixed ones under and outside the destination root, and the strings
// of the options themselves placed under the root, right after it and alone, so that the rules'
// own match values are met.
void collectStrings(PVRef value, std::vector<std::string> *strings) {
  if (strings->size() >= kMaxStrings) return;
  switch (PVGetType(value)) {
    case kPVTypeString: {
      const char *text = PVStringGetCStringPtr(static_cast<PVStringRef>(value), kPVStringEncodingUTF8);
      if (text) strings->push_back(text);
      break;
    }
    case kPVTypeArray:
      for (PVIndex i = 0; i < PVArrayGetCount(static_cast<PVArrayRef>(value)); i++)
        collectStrings(PVArrayGetValueAtIndex(static_cast<PVArrayRef>(value), i), strings);
      break;
    case kPVTypeDictionary: {
      auto dictionary = static_cast<PVDictionaryRef>(value);
      if (PVDictionaryGetValueMode(dictionary) != kPVDictionaryRetainedValues) break;
      std::vector<PVRef> keys(static_cast<size_t>(PVDictionaryGetCount(dictionary)));
      std::vector<const void *> values(keys.size());
      PVDictionaryGetKeysAndValues(dictionary, keys.data(), values.data());
      for (const void *element : values) collectStrings(element, strings);
      break;
    }
    default:
      break;
  }
}

std::vector<std::string> pathsFor(PVRef options) {
  std::vector<std::string> paths = {"/Volumes/T/usr/lib/libz.dylib",
                                    "/Volumes/T/./System/x.log",
                                    "/Volumes/T//a/b.jpg",
                                    "/Volumes/Tx/usr",
                                    "/other/usr/lib",
                                    "/Volumes/T"};
  std::vector<std::string> strings;
  collectStrings(options, &strings);
  for (const std::string &text : strings) {
    paths.push_back(std::string(kPrefix) + text);
    paths.push_back(std::string(kPrefix) + "/" + text);
    paths.push_back(text);
  }
  return paths;
}

PVDictionaryRef optionsFrom(PVRef parsed) {
  if (PVGetType(parsed) == kPVTypeDictionary) return static_cast<PVDictionaryRef>(PVRetain(parsed));
  if (PVGetType(parsed) != kPVTypeArray) return nullptr;
  PVMutableDictionaryRef options = PVDictionaryCreateMutable(2, kPVDictionaryRetainedValues);
  FUZZ_CHECK(options && PVDictionarySetValue(options, kPLZCCompressionRulesKey, parsed) &&
                 PVDictionarySetValue(options, kPLZCCompressionSystemRulesKey, parsed),
             "cannot build options");
  return options;
}

// The settings file holds at most 16 bytes, read as atoi reads them.
void checkSettings(const Bytes &text) {
  std::string path = scratchDir() + "/CompressionLevel";
  FUZZ_CHECK(writeWholeFile(path, text), "cannot write %s", path.c_str());
  int32_t level = getCompressionLevelFrom(path.c_str());
  std::string terminated(text.begin(), text.end());
  int32_t expected = text.size() > 16 ? 5 : atoi(terminated.c_str());
  FUZZ_CHECK(level == expected, "settings level %d, expected %d", level, expected);
}

Bytes input(const std::string &settings, const Bytes &list) {
  return InputWriter().u8(static_cast<uint8_t>(settings.size())).bytes(settings).bytes(list).data();
}
Bytes input(const std::string &settings, const std::string &list) {
  return input(settings, Bytes(list.begin(), list.end()));
}

std::string rule(const char *type, const char *key, const char *value) {
  return std::string("<dict><key>RuleType</key><string>") + type + "</string><key>" + key + "</key><string>" + value +
         "</string></dict>";
}

// The bundle's rules, and options dictionaries with every key the queue reads.
void writeSeeds(SeedSink &seeds) {
  seeds.add("bundle-rules", input("9\n", bundleRules()));
  std::string userRules = "<array>" + rule("Exclude", "PathEndsWithString", ".log") +
                          rule("Include", "PathBeginsWithString", "/usr") +
                          rule("Exclude", "PathContainsString", "lib") +
                          rule("Include", "PathExactlyEqualsString", "/usr/lib/libz.dylib") + "</array>";
  seeds.add(
      "every-option",
      input(" -3", xmlPropertyList("<dict><key>CompressionRules</key>" + userRules +
                                   "<key>SystemCompressionRules</key><array>" +
                                   rule("Include", "PathEndsWithString", "/x.log") +
                                   "</array>"
                                   "<key>CompressionTypes</key><string>3,4</string>"
                                   "<key>CompressionLevel</key><integer>9</integer>"
                                   "<key>AllowLargeResourceForks</key><true/>"
                                   "<key>PLZCThrottledIO</key><false/>"
                                   "<key>IgnoreXattrErrors</key><true/>"
                                   "<key>SkipMachOFileTypes</key><array><string>MH_EXECUTE</string>"
                                   "<integer>6</integer><integer>31</integer></array>"
                                   "<key>SkipMachOOverridePaths</key><array><string>/usr/bin/tool</string></array>"
                                   "</dict>")));
  seeds.add("every-type", input("", xmlPropertyList("<dict><key>SkipMachOFileTypes</key><array><string>bogus</string>"
                                                    "<string>*</string></array></dict>")));
  seeds.add("bad-level", input("abc", xmlPropertyList("<dict><key>CompressionLevel</key><real>2.5</real>"
                                                      "<key>CompressionTypes</key><string>7</string></dict>")));
  seeds.add("bad-rules", input("7", xmlPropertyList("<dict><key>CompressionRules</key><array><dict>"
                                                    "<key>RuleType</key><string>include</string></dict>"
                                                    "<integer>1</integer></array></dict>")));
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  InputReader reader(data, size);
  checkSettings(reader.bytes(reader.u8() % 18));
  Bytes list = reader.rest();
  PVDataRef bytes = PVDataCreate(list.data(), static_cast<PVIndex>(list.size()));
  PVRef parsed = PVPropertyListCreateWithXMLData(bytes);
  PVRelease(bytes);
  PVDictionaryRef options = optionsFrom(parsed);
  PVRelease(parsed);
  if (!options) return 0;

  StreamCompressorQueue *queue = CreateStreamCompressorQueueWithOptions(options);
  uint32_t mask = 0;
  int maskResult = _ComputeMachOTypeMask(&mask, options);
  if (!queue) {
    FUZZ_CHECK(maskResult == -1, "queue refused with valid Mach-O types");
    PVRelease(options);
    return 0;
  }
  FUZZ_CHECK(maskResult == 0 && queue->skipMachOTypeMask == mask, "queue made with invalid Mach-O types");
  FUZZ_CHECK(mask == 0xFFFFFFFF || (mask & 1) == 0, "Mach-O mask 0x%x has bit 0", mask);
  FUZZ_CHECK(mask != 0 || queue->skipMachOOverridePaths == nullptr, "override paths without a mask");

  bool initialized = _SQLazyInit(queue);
  if (initialized) {
    for (const std::string &path : pathsFor(options)) {
      uint8_t decision = _ShouldCompressPath(queue->rules, path.c_str(), kPrefix);
      FUZZ_CHECK(decision <= 1, "decision %u for %s", decision, path.c_str());
      FUZZ_CHECK(_ShouldCompressPath(queue->rules, path.c_str(), kPrefix) == decision, "two decisions for %s",
                 path.c_str());
    }
  }
  int finished = FinishStreamCompressorQueue(queue);
  FUZZ_CHECK(!initialized || finished == 0, "finish failed after a good initialisation: %s", strerror(errno));
  FUZZ_CHECK(finished == 0 || errno == EINVAL, "finish failed with %s", strerror(errno));
  PVRelease(options);
  return 0;
}
