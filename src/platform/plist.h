// The daemon's property-list value: dictionary, array, string, signed and
// unsigned integer, real, boolean, data and date. Equality is exact: two values
// are equal only when they have the same type and the same contents, except
// that a signed and an unsigned integer of the same value are equal (a binary
// property list keeps no sign for values that fit both).
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace kestrel {

class PlistValue;

using PlistDictionary = std::map<std::string, PlistValue, std::less<>>;
using PlistArray = std::vector<PlistValue>;
using PlistData = std::vector<std::uint8_t>;

// A point in time, in seconds since 2001-01-01 00:00:00 UTC (the property-list epoch).
struct PlistDate {
  double secondsSinceReferenceDate = 0;
  friend bool operator==(const PlistDate&, const PlistDate&) = default;
};

class PlistValue {
 public:
  enum class Type { Dictionary, Array, String, Integer, UnsignedInteger, Real, Boolean, Data, Date };

  PlistValue() : value_(PlistDictionary{}) {}
  PlistValue(PlistDictionary v) : value_(std::move(v)) {}                   // NOLINT
  PlistValue(PlistArray v) : value_(std::move(v)) {}                        // NOLINT
  PlistValue(std::string v) : value_(std::move(v)) {}                       // NOLINT
  PlistValue(std::string_view v) : value_(std::string(v)) {}                // NOLINT
  PlistValue(const char* v) : value_(std::string(v)) {}                     // NOLINT
  PlistValue(std::int64_t v) : value_(v) {}                                 // NOLINT
  PlistValue(int v) : value_(static_cast<std::int64_t>(v)) {}               // NOLINT
  PlistValue(std::uint64_t v) : value_(v) {}                                // NOLINT
  PlistValue(unsigned v) : value_(static_cast<std::uint64_t>(v)) {}         // NOLINT
  PlistValue(double v) : value_(v) {}                                       // NOLINT
  PlistValue(bool v) : value_(v) {}                                         // NOLINT
  PlistValue(PlistData v) : value_(std::move(v)) {}                         // NOLINT
  PlistValue(PlistDate v) : value_(v) {}                                    // NOLINT

  Type type() const { return static_cast<Type>(value_.index()); }

  bool isDictionary() const { return type() == Type::Dictionary; }
  bool isArray() const { return type() == Type::Array; }
  bool isString() const { return type() == Type::String; }
  bool isBoolean() const { return type() == Type::Boolean; }
  bool isData() const { return type() == Type::Data; }
  // Either integer type, or a real: what a reader would call "a number".
  bool isNumber() const {
    return type() == Type::Integer || type() == Type::UnsignedInteger || type() == Type::Real;
  }

  // Typed access: nullptr when the value has another type.
  const PlistDictionary* dictionary() const { return std::get_if<PlistDictionary>(&value_); }
  PlistDictionary* dictionary() { return std::get_if<PlistDictionary>(&value_); }
  const PlistArray* array() const { return std::get_if<PlistArray>(&value_); }
  PlistArray* array() { return std::get_if<PlistArray>(&value_); }
  const std::string* string() const { return std::get_if<std::string>(&value_); }
  const PlistData* data() const { return std::get_if<PlistData>(&value_); }
  const PlistDate* date() const { return std::get_if<PlistDate>(&value_); }
  std::optional<bool> boolean() const;
  std::optional<double> real() const;

  // Integer views of a number; nullopt for other types and for values that the
  // target type cannot hold (a negative number has no unsigned value).
  std::optional<std::int64_t> signedInteger() const;
  std::optional<std::uint64_t> unsignedInteger() const;

  // Dictionary member lookup; nullptr when this is not a dictionary or the key is absent.
  const PlistValue* find(std::string_view key) const;

  // A readable rendering used by the "%@" placeholder of log and error messages.
  std::string description() const;

  friend bool operator==(const PlistValue& a, const PlistValue& b);

 private:
  std::variant<PlistDictionary, PlistArray, std::string, std::int64_t, std::uint64_t, double, bool,
               PlistData, PlistDate>
      value_;
};

}  // namespace kestrel
