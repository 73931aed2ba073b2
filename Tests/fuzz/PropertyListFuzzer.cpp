// Fuzz target: XML property lists, parsed by libplist and turned into property values
// (Common/PropertyValuePropertyList), then described, hashed, compared and copied as the
// library's users of options and rules do.
//
// Input: the property list's bytes.
#include <cstdlib>
#include <cstring>
#include <string>

#include "FuzzSupport.h"
#include "PropertyValue.h"

using namespace plzcfuzz;

namespace {

PVRef parse(const uint8_t *data, size_t size) {
  PVDataRef bytes = PVDataCreate(data, static_cast<PVIndex>(size));
  FUZZ_CHECK(bytes, "PVDataCreate failed");
  PVRef value = PVPropertyListCreateWithXMLData(bytes);
  PVRelease(bytes);
  return value;
}

// A copy of a container is equal to it and hashes alike.
void checkCopy(PVRef value) {
  PVRef copy = nullptr;
  if (PVGetType(value) == kPVTypeArray) copy = PVArrayCreateMutableCopy(static_cast<PVArrayRef>(value));
  if (PVGetType(value) == kPVTypeDictionary) copy = PVDictionaryCreateMutableCopy(static_cast<PVDictionaryRef>(value));
  if (!copy) return;
  FUZZ_CHECK(PVEqual(value, copy) && PVHash(value) == PVHash(copy), "a copy differs from its original");
  PVRelease(copy);
}

// The bundle's rules, and a list with every kind of value the conversion knows.
void writeSeeds(SeedSink &seeds) {
  seeds.add("bundle-rules", bundleRules());
  seeds.add(
      "every-kind",
      xmlPropertyList("<dict><key>text</key><string>a &lt;b&gt; &amp; \"c\"\t\u00e9</string>"
                      "<key>count</key><integer>-42</integer><key>big</key><integer>18446744073709551615</integer>"
                      "<key>ratio</key><real>2.5</real><key>odd</key><real>nan</real>"
                      "<key>yes</key><true/><key>no</key><false/>"
                      "<key>bytes</key><data>AAEC/w==</data><key>empty</key><array/>"
                      "<key>nested</key><array><dict><key>x</key><array><integer>1</integer></array></dict>"
                      "<string></string></array></dict>"));
  std::string deep = "<integer>1</integer>";
  for (int i = 0; i < 40; i++) deep = "<array>" + deep + "</array>";
  seeds.add("deep", xmlPropertyList(deep));
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  PVRef first = parse(data, size);
  PVRef second = parse(data, size);
  FUZZ_CHECK((first == nullptr) == (second == nullptr), "one parse failed, the other did not");
  if (!first) return 0;
  FUZZ_CHECK(PVEqual(first, first), "a value differs from itself");
  FUZZ_CHECK(PVEqual(first, second) && PVHash(first) == PVHash(second), "two parses of one list differ");
  char *description = PVCopyDescriptionCString(first);
  char *again = PVCopyDescriptionCString(second);
  FUZZ_CHECK(description && again && strcmp(description, again) == 0, "two descriptions of one list differ");
  free(description);
  free(again);
  checkCopy(first);
  PVRelease(first);
  PVRelease(second);
  return 0;
}
