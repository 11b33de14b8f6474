#include "platform/plist.h"

#include <cctype>
#include <cmath>
#include <cstdio>
#include <limits>

namespace kestrel {

std::optional<bool> PlistValue::boolean() const {
  if (const bool* b = std::get_if<bool>(&value_)) return *b;
  return std::nullopt;
}

std::optional<double> PlistValue::real() const {
  if (const double* d = std::get_if<double>(&value_)) return *d;
  if (const std::int64_t* i = std::get_if<std::int64_t>(&value_)) return static_cast<double>(*i);
  if (const std::uint64_t* u = std::get_if<std::uint64_t>(&value_)) return static_cast<double>(*u);
  return std::nullopt;
}

std::optional<std::int64_t> PlistValue::signedInteger() const {
  if (const std::int64_t* i = std::get_if<std::int64_t>(&value_)) return *i;
  if (const std::uint64_t* u = std::get_if<std::uint64_t>(&value_)) {
    if (*u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
      return static_cast<std::int64_t>(*u);
    }
    return std::nullopt;
  }
  if (const double* d = std::get_if<double>(&value_)) {
    if (std::isfinite(*d) && *d >= -9.2233720368547758e18 && *d < 9.2233720368547758e18) {
      return static_cast<std::int64_t>(*d);
    }
  }
  return std::nullopt;
}

std::optional<std::uint64_t> PlistValue::unsignedInteger() const {
  if (const std::uint64_t* u = std::get_if<std::uint64_t>(&value_)) return *u;
  if (const std::int64_t* i = std::get_if<std::int64_t>(&value_)) {
    if (*i >= 0) return static_cast<std::uint64_t>(*i);
    return std::nullopt;
  }
  if (const double* d = std::get_if<double>(&value_)) {
    if (std::isfinite(*d) && *d >= 0 && *d < 1.8446744073709552e19) {
      return static_cast<std::uint64_t>(*d);
    }
  }
  return std::nullopt;
}

bool operator==(const PlistValue& a, const PlistValue& b) {
  const bool aInteger = a.type() == PlistValue::Type::Integer || a.type() == PlistValue::Type::UnsignedInteger;
  const bool bInteger = b.type() == PlistValue::Type::Integer || b.type() == PlistValue::Type::UnsignedInteger;
  if (aInteger && bInteger && a.type() != b.type()) {
    // Mixed signedness: equal only when both sides name the same non-negative value.
    const auto au = a.unsignedInteger();
    const auto bu = b.unsignedInteger();
    return au && bu && *au == *bu;
  }
  return a.value_ == b.value_;
}

const PlistValue* PlistValue::find(std::string_view key) const {
  const PlistDictionary* dict = dictionary();
  if (dict == nullptr) return nullptr;
  auto it = dict->find(key);
  return it == dict->end() ? nullptr : &it->second;
}

namespace {

void appendQuoted(std::string& out, const std::string& s) {
  bool plain = !s.empty();
  for (char c : s) {
    if (!(std::isalnum(static_cast<unsigned char>(c)) || c == '.' || c == '_' || c == '-' ||
          c == '/')) {
      plain = false;
      break;
    }
  }
  if (plain) {
    out += s;
    return;
  }
  out += '"';
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    out += c;
  }
  out += '"';
}

void describe(const PlistValue& v, std::string& out, int depth) {
  const std::string indent(static_cast<size_t>(depth) * 4, ' ');
  switch (v.type()) {
    case PlistValue::Type::Dictionary: {
      out += "{\n";
      for (const auto& [key, value] : *v.dictionary()) {
        out += indent + "    ";
        appendQuoted(out, key);
        out += " = ";
        describe(value, out, depth + 1);
        out += ";\n";
      }
      out += indent + "}";
      break;
    }
    case PlistValue::Type::Array: {
      out += "(\n";
      const PlistArray& array = *v.array();
      for (size_t i = 0; i < array.size(); ++i) {
        out += indent + "    ";
        describe(array[i], out, depth + 1);
        out += (i + 1 < array.size()) ? ",\n" : "\n";
      }
      out += indent + ")";
      break;
    }
    case PlistValue::Type::String:
      appendQuoted(out, *v.string());
      break;
    case PlistValue::Type::Integer:
      out += std::to_string(*v.signedInteger());
      break;
    case PlistValue::Type::UnsignedInteger:
      out += std::to_string(*v.unsignedInteger());
      break;
    case PlistValue::Type::Real: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "%g", *v.real());
      out += buf;
      break;
    }
    case PlistValue::Type::Boolean:
      out += *v.boolean() ? "1" : "0";
      break;
    case PlistValue::Type::Data: {
      static const char* hex = "0123456789abcdef";
      out += '<';
      const PlistData& data = *v.data();
      for (size_t i = 0; i < data.size(); ++i) {
        if (i > 0 && i % 4 == 0) out += ' ';
        out += hex[data[i] >> 4];
        out += hex[data[i] & 15];
      }
      out += '>';
      break;
    }
    case PlistValue::Type::Date: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "date(%.3f)", v.date()->secondsSinceReferenceDate);
      out += buf;
      break;
    }
  }
}

}  // namespace

std::string PlistValue::description() const {
  std::string out;
  describe(*this, out, 0);
  return out;
}

}  // namespace kestrel
