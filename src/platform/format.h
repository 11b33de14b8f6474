// The one formatter for the daemon's log and error messages. Messages keep their
// printf-style placeholders (%d, %u, %ld, %llu, %lld, %x, %s, %f, %%) plus "%@",
// which renders the argument's description: strings as themselves, numbers in
// decimal, objects through their description() and an absent object as "(null)".
#pragma once

#include <concepts>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

namespace kestrel {

class FormatArg {
 public:
  enum class Kind { Signed, Unsigned, Real, Text, Null };

  FormatArg(std::nullptr_t) : kind_(Kind::Null) {}  // NOLINT
  FormatArg(bool v) : kind_(Kind::Signed), signed_(v ? 1 : 0) {}  // NOLINT
  FormatArg(char v) : kind_(Kind::Signed), signed_(v) {}  // NOLINT
  template <std::signed_integral T>
  FormatArg(T v) : kind_(Kind::Signed), signed_(v) {}  // NOLINT
  template <std::unsigned_integral T>
    requires(!std::same_as<T, bool>)
  FormatArg(T v) : kind_(Kind::Unsigned), unsigned_(v) {}  // NOLINT
  template <typename T>
    requires std::is_enum_v<T>
  FormatArg(T v) : FormatArg(static_cast<std::underlying_type_t<T>>(v)) {}  // NOLINT
  FormatArg(double v) : kind_(Kind::Real), real_(v) {}  // NOLINT
  FormatArg(const char* v) : kind_(v ? Kind::Text : Kind::Null), text_(v ? v : "") {}  // NOLINT
  FormatArg(char* v) : FormatArg(static_cast<const char*>(v)) {}  // NOLINT
  FormatArg(std::string v) : kind_(Kind::Text), text_(std::move(v)) {}  // NOLINT
  FormatArg(std::string_view v) : kind_(Kind::Text), text_(v) {}  // NOLINT
  // Anything with a description(): error objects, property-list values, URLs...
  template <typename T>
    requires requires(const T& t) {
      { t.description() } -> std::convertible_to<std::string>;
    }
  FormatArg(const T& v) : kind_(Kind::Text), text_(v.description()) {}  // NOLINT
  template <typename T>
  FormatArg(const std::shared_ptr<T>& p) : FormatArg(p ? FormatArg(*p) : FormatArg(nullptr)) {}  // NOLINT
  template <typename T>
  FormatArg(const std::optional<T>& v) : FormatArg(v ? FormatArg(*v) : FormatArg(nullptr)) {}  // NOLINT

  Kind kind() const { return kind_; }
  std::int64_t asSigned() const;
  std::uint64_t asUnsigned() const;
  double asReal() const;
  // The "%@" rendering.
  std::string description() const;
  // The "%s" rendering.
  const std::string& text() const { return text_; }

 private:
  Kind kind_;
  std::int64_t signed_ = 0;
  std::uint64_t unsigned_ = 0;
  double real_ = 0;
  std::string text_;
};

std::string formatMessageArgs(std::string_view format, const std::vector<FormatArg>& args);

template <typename... Args>
std::string formatMessage(std::string_view format, Args&&... args) {
  return formatMessageArgs(format, std::vector<FormatArg>{FormatArg(std::forward<Args>(args))...});
}

}  // namespace kestrel
