// printf-style formatting of the daemon's log and error texts.
//
// The texts are used exactly as they stand, with "%@" meaning "any object":
// an argument with a description() member (or a pointer / shared_ptr to one)
// prints that description, a string prints itself. Privacy annotations such
// as "%{public}s" or "%{private, signpost.description:attribute}@" are
// accepted and ignored. A conversion without a matching argument prints
// "(missing)" rather than reading past the argument list, so a wrong format
// can never crash the daemon. Thread-safe, no global state.
#pragma once

#include <concepts>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

struct VSAFormatArg {
  enum class Kind { Signed, Unsigned, Double, Text, Pointer };
  Kind kind = Kind::Text;
  int64_t i = 0;
  uint64_t u = 0;
  double d = 0;
  std::string text;
  const void* pointer = nullptr;
};

template <typename T>
concept VSADescribable = requires(const T& t) {
  { t.description() } -> std::convertible_to<std::string>;
};

namespace vsa_format_detail {

template <typename T>
VSAFormatArg makeArg(const T& value) {
  VSAFormatArg a;
  using D = std::decay_t<T>;
  if constexpr (std::is_same_v<D, bool>) {
    a.kind = VSAFormatArg::Kind::Signed;
    a.i = value ? 1 : 0;
    a.u = a.i;
  } else if constexpr (std::is_enum_v<D>) {
    a.kind = VSAFormatArg::Kind::Signed;
    a.i = static_cast<int64_t>(value);
    a.u = static_cast<uint64_t>(value);
  } else if constexpr (std::is_integral_v<D> && std::is_signed_v<D>) {
    a.kind = VSAFormatArg::Kind::Signed;
    a.i = value;
    a.u = static_cast<uint64_t>(value);
  } else if constexpr (std::is_integral_v<D>) {
    a.kind = VSAFormatArg::Kind::Unsigned;
    a.u = value;
    a.i = static_cast<int64_t>(value);
  } else if constexpr (std::is_floating_point_v<D>) {
    a.kind = VSAFormatArg::Kind::Double;
    a.d = value;
  } else if constexpr (std::is_array_v<std::remove_cvref_t<T>>) {
    a.text = std::string(value);
  } else if constexpr (std::is_same_v<D, const char*> || std::is_same_v<D, char*>) {
    a.text = value ? value : "(null)";
  } else if constexpr (std::is_convertible_v<const T&, std::string_view>) {
    a.text = std::string(std::string_view(value));
  } else if constexpr (VSADescribable<D>) {
    a.text = value.description();
  } else if constexpr (std::is_pointer_v<D>) {
    using P = std::remove_cv_t<std::remove_pointer_t<D>>;
    if constexpr (VSADescribable<P>) {
      a.text = value ? value->description() : "(null)";
    }
    a.pointer = value;
    if constexpr (!VSADescribable<P>) a.kind = VSAFormatArg::Kind::Pointer;
  } else if constexpr (requires {
                         value.get();
                         *value;
                       }) {  // shared_ptr / unique_ptr
    a.pointer = value.get();
    a.text = value ? makeArg(*value).text : "(null)";
  } else if constexpr (std::is_same_v<D, std::nullptr_t>) {
    a.text = "(null)";
  } else {
    static_assert(sizeof(D) == 0, "VSAFormat: argument type cannot be formatted");
  }
  return a;
}

}  // namespace vsa_format_detail

// Formats with an already converted argument list.
std::string VSAFormatArgs(std::string_view format, const std::vector<VSAFormatArg>& args);

template <typename... A>
std::string VSAFormat(std::string_view format, const A&... args) {
  std::vector<VSAFormatArg> list;
  list.reserve(sizeof...(A));
  (list.push_back(vsa_format_detail::makeArg(args)), ...);
  return VSAFormatArgs(format, list);
}
