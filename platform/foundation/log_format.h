#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <ranges>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>

namespace yomber {

// ---- The grammar: one for the compile-time check and for the rendering -----------------------

/// One conversion of a format, e.g. "%llx".
struct LogConversion {
  char letter = 0;         ///< one of "@sduxf%"
  bool is64Bit = false;    ///< has a length of l, ll or z
  int precision = 6;       ///< digits after the point, for 'f'
  std::size_t length = 0;  ///< characters of the conversion, with its '%'
};

/// Reads the conversion that `text` begins with; nothing when there is no such conversion.
constexpr std::optional<LogConversion> parseLogConversion(std::string_view text) {
  constexpr int kMaximumPrecision = 17;
  LogConversion result;
  std::size_t at = 1;
  const auto peek = [&] { return at < text.size() ? text[at] : '\0'; };
  const bool hasPrecision = peek() == '.';
  if (hasPrecision) {
    result.precision = 0;
    for (++at; peek() >= '0' && peek() <= '9' && result.precision <= kMaximumPrecision; ++at) {
      result.precision = result.precision * 10 + (peek() - '0');
    }
    if (result.precision > kMaximumPrecision) return std::nullopt;
  }
  const std::size_t lengthBegin = at;
  while (peek() == 'l' && at < lengthBegin + 2) ++at;
  if (at == lengthBegin && peek() == 'z') ++at;
  result.is64Bit = at != lengthBegin;
  result.letter = peek();
  result.length = at + 1;
  const bool known = std::string_view("@sduxf%").find(result.letter) != std::string_view::npos;
  const bool integral = result.letter == 'd' || result.letter == 'u' || result.letter == 'x';
  if (result.letter == '\0' || !known) return std::nullopt;
  if (result.is64Bit && !integral) return std::nullopt;
  if (hasPrecision && result.letter != 'f') return std::nullopt;
  return result;
}

// ---- What can be printed ---------------------------------------------------------------------

namespace log_detail {

template <typename T>
concept Text = std::is_convertible_v<const T&, std::string_view>;

template <typename T>
concept Described = requires(const T& value) {
  { value.description() } -> std::convertible_to<std::string>;
};

/// Raw and smart pointers and std::optional: what may be nil.
template <typename T>
concept Nullable = !std::is_array_v<T> && requires(const T& value) {
  { *value };
  { static_cast<bool>(value) };
};

template <typename T>
concept Mapping = std::ranges::input_range<const T> && requires { typename T::mapped_type; };

/// A range whose elements are something else than itself (unlike std::filesystem::path).
template <typename T>
concept List = std::ranges::input_range<const T> &&
               !std::is_same_v<std::remove_cvref_t<std::ranges::range_reference_t<const T>>, T>;

template <typename T>
consteval bool isPrintable() {
  using V = std::remove_cvref_t<T>;
  if constexpr (std::is_null_pointer_v<V> || std::is_arithmetic_v<V> || Text<V> || Described<V>) {
    return true;
  } else if constexpr (Nullable<V>) {
    return isPrintable<decltype(*std::declval<const V&>())>();
  } else if constexpr (Mapping<V>) {
    return isPrintable<typename V::key_type>() && isPrintable<typename V::mapped_type>();
  } else if constexpr (List<V>) {
    return isPrintable<std::ranges::range_reference_t<const V>>();
  } else {
    return false;
  }
}

/// Whether an argument of type T may stand for `conversion`.
template <typename T>
consteval bool fits(const LogConversion& conversion) {
  using V = std::remove_cvref_t<T>;
  constexpr bool integral = std::is_integral_v<V>;
  constexpr bool isBool = std::is_same_v<V, bool>;
  const std::size_t room = conversion.is64Bit ? 8 : 4;
  switch (conversion.letter) {
    case '@':
      return isPrintable<V>();
    case 's':
      return Text<V>;
    case 'f':
      return std::is_floating_point_v<V>;
    case 'd':
      return integral && (std::is_signed_v<V> || isBool) && sizeof(V) <= room;
    default:
      return integral && std::is_unsigned_v<V> && !isBool && sizeof(V) <= room;
  }
}

/// An argument without its static type.
struct Argument {
  enum class Type : std::uint8_t { Null, Signed, Unsigned, Real, Text, Object };
  using Append = void (*)(std::string& out, const void* object);

  Type type = Type::Null;
  std::int64_t signedValue = 0;
  std::uint64_t unsignedValue = 0;
  double realValue = 0;
  std::string_view text{};
  const void* object = nullptr;
  Append append = nullptr;
};

void appendNull(std::string& out);
void appendArgument(std::string& out, const Argument& argument);
std::string render(std::string_view format, std::span<const Argument> arguments);

template <typename T>
Argument makeArgument(const T& value);

template <typename T>
void append(std::string& out, const T& value) {
  appendArgument(out, makeArgument(value));
}

template <typename T>
void appendMapping(std::string& out, const T& mapping) {
  const char* separator = "{";
  for (const auto& [key, value] : mapping) {
    out += separator;
    append(out, key);
    out += " = ";
    append(out, value);
    separator = ", ";
  }
  out += mapping.begin() == mapping.end() ? "{}" : "}";
}

template <typename T>
void appendList(std::string& out, const T& list) {
  bool first = true;
  out += '(';
  for (const auto& element : list) {
    if (!first) out += ", ";
    append(out, element);
    first = false;
  }
  out += ')';
}

template <typename T>
void appendObject(std::string& out, const void* object) {
  const T& value = *static_cast<const T*>(object);
  if constexpr (Described<T>) {
    out += value.description();
  } else if constexpr (Mapping<T>) {
    appendMapping(out, value);
  } else {
    appendList(out, value);
  }
}

template <typename T>
Argument makeText(const T& value) {
  if constexpr (std::is_pointer_v<T>) {
    if (value == nullptr) return {};
  }
  return {.type = Argument::Type::Text, .text = std::string_view(value)};
}

template <typename T>
Argument makeArgument(const T& value) {
  if constexpr (std::is_null_pointer_v<T>) {
    return {};
  } else if constexpr (std::is_floating_point_v<T>) {
    return {.type = Argument::Type::Real, .realValue = static_cast<double>(value)};
  } else if constexpr (std::is_unsigned_v<T> && !std::is_same_v<T, bool>) {
    return {.type = Argument::Type::Unsigned, .unsignedValue = value};
  } else if constexpr (std::is_integral_v<T>) {
    return {.type = Argument::Type::Signed, .signedValue = value};
  } else if constexpr (Text<T>) {
    return makeText(value);
  } else if constexpr (!Described<T> && Nullable<T>) {
    return static_cast<bool>(value) ? makeArgument(*value) : Argument{};
  } else {
    return {.type = Argument::Type::Object, .object = &value, .append = &appendObject<T>};
  }
}

// Never defined: reaching one of them is what fails the constant evaluation of a wrong format.
void thisIsNoKnownConversion();
void thereAreFewerArgumentsThanConversions();
void thereAreMoreArgumentsThanConversions();
void theArgumentDoesNotFitItsConversion();

}  // namespace log_detail

/// A printf-like format whose conversions were checked against `Args` at compile time.
///
/// Conversions: `%d %u %x` with lengths `l`, `ll` and `z`; `%f` and `%.Nf`; `%s` for C and C++
/// strings; `%%`; and `%@` for anything that has a `description`, strings, numbers, lists as
/// "(a, b)", mappings as "{k = v}", and what may be nil, which prints as "(null)". An integer's
/// signedness must be the conversion's and its width at most the conversion's; bool goes with %d.
template <typename... Args>
class LogFormat {
 public:
  template <std::size_t N>
  consteval LogFormat(const char (&text)[N]) : text_(text, N - 1) {  // NOLINT: implicit by design
    check();
  }

  [[nodiscard]] std::string render(const Args&... args) const {
    const std::array<log_detail::Argument, sizeof...(Args)> arguments{
        log_detail::makeArgument(args)...};
    return log_detail::render(text_, arguments);
  }

 private:
  consteval void check() const {
    std::size_t argument = 0;
    for (std::size_t at = text_.find('%'); at != std::string_view::npos;) {
      const auto conversion = parseLogConversion(text_.substr(at));
      if (!conversion) log_detail::thisIsNoKnownConversion();
      if (conversion->letter != '%') checkArgument(argument++, *conversion);
      at = text_.find('%', at + conversion->length);
    }
    if (argument < sizeof...(Args)) log_detail::thereAreMoreArgumentsThanConversions();
  }

  static consteval void checkArgument(std::size_t index, const LogConversion& conversion) {
    if (index >= sizeof...(Args)) log_detail::thereAreFewerArgumentsThanConversions();
    std::size_t current = 0;
    const bool fit = ((current++ != index || log_detail::fits<Args>(conversion)) && ...);
    if (!fit) log_detail::theArgumentDoesNotFitItsConversion();
  }

  std::string_view text_;
};

}  // namespace yomber
