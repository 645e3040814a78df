#include "platform/foundation/log_format.h"

#include <charconv>
#include <system_error>

namespace yomber::log_detail {
namespace {

template <typename T, typename... Format>
void appendNumber(std::string& out, T value, Format... format) {
  std::array<char, 352> buffer;  // the longest double in fixed notation, with 17 digits
  const auto [end, failure] =
      std::to_chars(buffer.data(), buffer.data() + buffer.size(), value, format...);
  if (failure == std::errc{}) out.append(buffer.data(), end);
}

void appendConversion(std::string& out, const LogConversion& conversion, const Argument& argument) {
  switch (conversion.letter) {
    case 'x':
      appendNumber(out, argument.unsignedValue, 16);
      break;
    case 'f':
      appendNumber(out, argument.realValue, std::chars_format::fixed, conversion.precision);
      break;
    default:
      appendArgument(out, argument);
  }
}

}  // namespace

void appendNull(std::string& out) { out += "(null)"; }

void appendArgument(std::string& out, const Argument& argument) {
  switch (argument.type) {
    case Argument::Type::Null:
      appendNull(out);
      break;
    case Argument::Type::Signed:
      appendNumber(out, argument.signedValue);
      break;
    case Argument::Type::Unsigned:
      appendNumber(out, argument.unsignedValue);
      break;
    case Argument::Type::Real:
      appendNumber(out, argument.realValue);
      break;
    case Argument::Type::Text:
      out += argument.text;
      break;
    case Argument::Type::Object:
      argument.append(out, argument.object);
      break;
  }
}

std::string render(std::string_view format, std::span<const Argument> arguments) {
  std::string out;
  out.reserve(format.size() + arguments.size() * 16);
  std::size_t argument = 0;
  while (true) {
    const std::size_t at = format.find('%');
    out += format.substr(0, at);
    if (at == std::string_view::npos) return out;
    format.remove_prefix(at);
    const auto conversion = parseLogConversion(format);
    if (!conversion) return out;  // cannot be: the format was checked when it was compiled
    if (conversion->letter == '%') {
      out += '%';
    } else {
      appendConversion(out, *conversion, arguments[argument++]);
    }
    format.remove_prefix(conversion->length);
  }
}

}  // namespace yomber::log_detail
