// Number values: integers kept as int64, floating values as double; getters convert and say
// whether the conversion was exact.
#include <cmath>
#include <cstring>
#include <limits>

#include "Common/PropertyValueObjects.h"
#include "PropertyValue.h"

namespace {

constexpr double kTwoTo63 = 9223372036854775808.0;

// Whether d is an integer that int64 holds, so that the cast is defined and exact.
bool isInt64(double d) { return d == std::trunc(d) && d >= -kTwoTo63 && d < kTwoTo63; }

PVNumberRef create(PVNumberType type, int64_t integer, double real) {
  return new (std::nothrow) PVNumber(type, integer, real);
}

// The number clamped to [low, high] as an integer; exact when nothing was cut or clamped.
bool toInteger(const PVNumber *number, int64_t low, int64_t high, int64_t *value) {
  if (number->numberType != kPVNumberDoubleType) {
    int64_t v = number->integer;
    *value = v < low ? low : v > high ? high : v;
    return v >= low && v <= high;
  }
  double d = number->real;
  if (std::isnan(d)) {
    *value = 0;
    return false;
  }
  double truncated = std::trunc(d);
  // Both lows (-2^31, -2^63) are exact as doubles; the int64 high rounds up to 2^63, which is
  // why the upper test goes through isInt64 before casting.
  if (truncated <= static_cast<double>(low)) {
    *value = low;
    return d == static_cast<double>(low);
  }
  if (truncated >= static_cast<double>(high)) {
    *value = high;
    return isInt64(d) && static_cast<int64_t>(d) == high;
  }
  *value = static_cast<int64_t>(truncated);
  return d == truncated;
}

}  // namespace

namespace pv {

bool numbersEqual(const PVNumber *a, const PVNumber *b) {
  bool aReal = a->numberType == kPVNumberDoubleType, bReal = b->numberType == kPVNumberDoubleType;
  if (!aReal && !bReal) return a->integer == b->integer;
  if (aReal && bReal) {
    // NaN equals NaN here so that every value equals itself (dictionary keys rely on it).
    if (std::isnan(a->real) || std::isnan(b->real)) return std::isnan(a->real) && std::isnan(b->real);
    return a->real == b->real;
  }
  const PVNumber *real = aReal ? a : b, *integer = aReal ? b : a;
  return isInt64(real->real) && static_cast<int64_t>(real->real) == integer->integer;
}

uint64_t hashNumber(const PVNumber *number) {
  if (number->numberType != kPVNumberDoubleType) return hashInteger(static_cast<uint64_t>(number->integer));
  double d = number->real;
  // Integral doubles hash as the equal integer; -0.0 is the integer 0.
  if (isInt64(d)) return hashInteger(static_cast<uint64_t>(static_cast<int64_t>(d)));
  if (std::isnan(d)) return hashInteger(0x7ff8000000000000ull);
  uint64_t bits;
  memcpy(&bits, &d, sizeof bits);
  return hashInteger(bits);
}

}  // namespace pv

extern "C" {

PVNumberRef PVNumberCreateInt32(int32_t value) { return create(kPVNumberInt32Type, value, 0); }

PVNumberRef PVNumberCreateInt64(int64_t value) { return create(kPVNumberInt64Type, value, 0); }

PVNumberRef PVNumberCreateDouble(double value) { return create(kPVNumberDoubleType, 0, value); }

PVNumberType PVNumberGetType(PVNumberRef number) {
  auto *n = pv::asNumber(number);
  return n ? n->numberType : static_cast<PVNumberType>(0);
}

bool PVNumberGetInt32(PVNumberRef number, int32_t *value) {
  auto *n = pv::asNumber(number);
  if (!n || !value) return false;
  int64_t wide;
  bool exact = toInteger(n, std::numeric_limits<int32_t>::min(), std::numeric_limits<int32_t>::max(), &wide);
  *value = static_cast<int32_t>(wide);
  return exact;
}

bool PVNumberGetInt64(PVNumberRef number, int64_t *value) {
  auto *n = pv::asNumber(number);
  if (!n || !value) return false;
  return toInteger(n, std::numeric_limits<int64_t>::min(), std::numeric_limits<int64_t>::max(), value);
}

bool PVNumberGetDouble(PVNumberRef number, double *value) {
  auto *n = pv::asNumber(number);
  if (!n || !value) return false;
  if (n->numberType == kPVNumberDoubleType) {
    *value = n->real;
    return true;
  }
  double d = static_cast<double>(n->integer);
  *value = d;
  return d < kTwoTo63 && static_cast<int64_t>(d) == n->integer;
}

}  // extern "C"
