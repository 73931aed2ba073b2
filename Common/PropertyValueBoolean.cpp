// Boolean values: two constants shared by everyone.
#include "Common/PropertyValueObjects.h"
#include "PropertyValue.h"

namespace {
constinit PVBoolean kTrue(true);
constinit PVBoolean kFalse(false);
}  // namespace

extern "C" {

const PVBooleanRef kPVBooleanTrue = &kTrue;
const PVBooleanRef kPVBooleanFalse = &kFalse;

bool PVBooleanGetValue(PVBooleanRef boolean) {
  auto *b = pv::asBoolean(boolean);
  return b && b->value;
}

}  // extern "C"
