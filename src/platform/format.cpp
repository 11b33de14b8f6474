#include "platform/format.h"

#include <cstdio>

namespace kestrel {

std::int64_t FormatArg::asSigned() const {
  switch (kind_) {
    case Kind::Signed: return signed_;
    case Kind::Unsigned: return static_cast<std::int64_t>(unsigned_);
    case Kind::Real: return static_cast<std::int64_t>(real_);
    default: return 0;
  }
}

std::uint64_t FormatArg::asUnsigned() const {
  switch (kind_) {
    case Kind::Signed: return static_cast<std::uint64_t>(signed_);
    case Kind::Unsigned: return unsigned_;
    case Kind::Real: return static_cast<std::uint64_t>(real_);
    default: return 0;
  }
}

double FormatArg::asReal() const {
  switch (kind_) {
    case Kind::Signed: return static_cast<double>(signed_);
    case Kind::Unsigned: return static_cast<double>(unsigned_);
    case Kind::Real: return real_;
    default: return 0;
  }
}

std::string FormatArg::description() const {
  switch (kind_) {
    case Kind::Signed: return std::to_string(signed_);
    case Kind::Unsigned: return std::to_string(unsigned_);
    case Kind::Real: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "%g", real_);
      return buf;
    }
    case Kind::Text: return text_;
    case Kind::Null: return "(null)";
  }
  return {};
}

namespace {

template <typename T>
void appendPrintf(std::string& out, const std::string& pattern, T value) {
  char stackBuf[256];
  int n = std::snprintf(stackBuf, sizeof stackBuf, pattern.c_str(), value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof stackBuf) {
    out.append(stackBuf, static_cast<size_t>(n));
    return;
  }
  std::string big(static_cast<size_t>(n) + 1, '\0');
  std::snprintf(big.data(), big.size(), pattern.c_str(), value);
  big.resize(static_cast<size_t>(n));
  out += big;
}

}  // namespace

std::string formatMessageArgs(std::string_view format, const std::vector<FormatArg>& args) {
  std::string out;
  out.reserve(format.size() + 32);
  size_t next = 0;
  static const FormatArg missing(nullptr);
  auto take = [&]() -> const FormatArg& { return next < args.size() ? args[next++] : missing; };

  for (size_t i = 0; i < format.size(); ++i) {
    char c = format[i];
    if (c != '%') {
      out += c;
      continue;
    }
    if (i + 1 < format.size() && format[i + 1] == '%') {
      out += '%';
      ++i;
      continue;
    }
    // %[flags][width][.precision][length]conversion
    size_t j = i + 1;
    std::string flags;
    while (j < format.size() && std::string_view("-+ #0").find(format[j]) != std::string_view::npos) {
      flags += format[j++];
    }
    while (j < format.size() && ((format[j] >= '0' && format[j] <= '9') || format[j] == '.')) {
      flags += format[j++];
    }
    int longs = 0;
    bool sizeModifier = false;
    while (j < format.size() && std::string_view("hlqjzt").find(format[j]) != std::string_view::npos) {
      if (format[j] == 'l' || format[j] == 'q') ++longs;
      if (format[j] == 'q') ++longs;
      if (format[j] == 'j' || format[j] == 'z' || format[j] == 't') sizeModifier = true;
      ++j;
    }
    if (j >= format.size()) {  // a dangling '%': keep it as written
      out.append(format.substr(i));
      break;
    }
    const char conversion = format[j];
    const bool wide = longs > 0 || sizeModifier;
    switch (conversion) {
      case '@':
        out += take().description();
        break;
      case 'd':
      case 'i': {
        std::int64_t v = take().asSigned();
        if (!wide) v = static_cast<int>(v);
        appendPrintf(out, "%" + flags + "lld", static_cast<long long>(v));
        break;
      }
      case 'u':
      case 'x':
      case 'X':
      case 'o': {
        std::uint64_t v = take().asUnsigned();
        if (!wide) v = static_cast<unsigned>(v);
        appendPrintf(out, "%" + flags + "ll" + conversion, static_cast<unsigned long long>(v));
        break;
      }
      case 'c': {
        out += static_cast<char>(take().asSigned());
        break;
      }
      case 'f':
      case 'F':
      case 'g':
      case 'G':
      case 'e':
      case 'E':
        appendPrintf(out, "%" + flags + conversion, take().asReal());
        break;
      case 's': {
        const FormatArg& arg = take();
        const std::string text = arg.kind() == FormatArg::Kind::Text ? arg.text() : arg.description();
        appendPrintf(out, "%" + flags + "s", text.c_str());
        break;
      }
      case 'p':
        appendPrintf(out, std::string("0x%llx"), static_cast<unsigned long long>(take().asUnsigned()));
        break;
      default:  // unknown conversion: keep it literally
        out.append(format.substr(i, j - i + 1));
        break;
    }
    i = j;
  }
  return out;
}

}  // namespace kestrel
