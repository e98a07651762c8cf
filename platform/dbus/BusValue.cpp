#include "platform/dbus/BusValue.h"

#include <fmt/format.h>

#include "platform/Misuse.h"

namespace platform {
namespace {

constexpr int kMaxStructDepth = 32;

[[noreturn]] void wrongKind(const char* wanted, const BusValue& value) {
  ::platform::detail::misuse(
      __FILE__, __LINE__,
      fmt::format("BusValue: asked for {} of a value of signature {}", wanted, value.signature()));
}

// Parses one complete type starting at `pos`; advances `pos` past it.
bool parseCompleteType(std::string_view signature, std::size_t& pos, int depth) {
  if (pos >= signature.size()) return false;
  switch (signature[pos]) {
    case 'b':
    case 'i':
    case 'u':
    case 'x':
    case 'd':
    case 's':
      ++pos;
      return true;
    case 'a':
      if (pos + 1 < signature.size() && signature[pos + 1] == 's') {
        pos += 2;
        return true;
      }
      if (pos + 1 < signature.size() && signature[pos + 1] == '(') {
        ++pos;
        return parseCompleteType(signature, pos, depth + 1);
      }
      return false;
    case '(': {
      if (depth >= kMaxStructDepth) return false;
      ++pos;
      int fields = 0;
      while (pos < signature.size() && signature[pos] != ')') {
        if (!parseCompleteType(signature, pos, depth + 1)) return false;
        ++fields;
      }
      if (pos >= signature.size() || fields == 0) return false;
      ++pos;  // ')'
      return true;
    }
    default:
      return false;
  }
}

}  // namespace

BusValue BusValue::structure(std::vector<BusValue> fields) {
  QV_MISUSE(fields.empty(), "BusValue: a struct needs at least one field");
  return BusValue(StructFields{std::move(fields)});
}

BusValue BusValue::array(std::string elementSignature, std::vector<BusValue> elements) {
  QV_MISUSE(!elementSignature.starts_with('(') || !isSupportedSignature(elementSignature),
            "BusValue: arrays hold structs, not {}", elementSignature);
#if defined(QUORVEL_DCHECK_IS_ON)
  // Worked out per element, so checked in debug builds only: a reply of a
  // thousand structs would spend more on this than on being sent.
  for (const BusValue& element : elements) {
    QV_MISUSE(element.signature() != elementSignature,
              "BusValue: an element of signature {} in an array of {}", element.signature(),
              elementSignature);
  }
#endif
  return BusValue(ArrayElements{std::move(elementSignature), std::move(elements)});
}

std::string BusValue::signature() const {
  switch (kind()) {
    case Kind::Bool:
      return "b";
    case Kind::Int32:
      return "i";
    case Kind::UInt32:
      return "u";
    case Kind::Int64:
      return "x";
    case Kind::Double:
      return "d";
    case Kind::String:
      return "s";
    case Kind::StringArray:
      return "as";
    case Kind::Struct:
      return fmt::format("({})", signatureOf(std::get<StructFields>(value_).fields));
    case Kind::Array:
      return "a" + std::get<ArrayElements>(value_).elementSignature;
  }
  return {};
}

bool BusValue::asBool() const {
  if (auto* v = std::get_if<bool>(&value_)) return *v;
  wrongKind("a boolean", *this);
}

std::int32_t BusValue::asInt32() const {
  if (auto* v = std::get_if<std::int32_t>(&value_)) return *v;
  wrongKind("an int32", *this);
}

std::uint32_t BusValue::asUInt32() const {
  if (auto* v = std::get_if<std::uint32_t>(&value_)) return *v;
  wrongKind("a uint32", *this);
}

std::int64_t BusValue::asInt64() const {
  if (auto* v = std::get_if<std::int64_t>(&value_)) return *v;
  wrongKind("an int64", *this);
}

double BusValue::asDouble() const {
  if (auto* v = std::get_if<double>(&value_)) return *v;
  wrongKind("a double", *this);
}

const std::string& BusValue::asString() const {
  if (auto* v = std::get_if<std::string>(&value_)) return *v;
  wrongKind("a string", *this);
}

const std::vector<std::string>& BusValue::asStringArray() const {
  if (auto* v = std::get_if<std::vector<std::string>>(&value_)) return *v;
  wrongKind("a string array", *this);
}

const std::vector<BusValue>& BusValue::fields() const {
  if (auto* v = std::get_if<StructFields>(&value_)) return v->fields;
  wrongKind("struct fields", *this);
}

const std::vector<BusValue>& BusValue::elements() const {
  if (auto* v = std::get_if<ArrayElements>(&value_)) return v->elements;
  wrongKind("array elements", *this);
}

std::string BusValue::debugDescription() const {
  switch (kind()) {
    case Kind::Bool:
      return asBool() ? "b:true" : "b:false";
    case Kind::Int32:
      return fmt::format("i:{}", asInt32());
    case Kind::UInt32:
      return fmt::format("u:{}", asUInt32());
    case Kind::Int64:
      return fmt::format("x:{}", asInt64());
    case Kind::Double:
      return fmt::format("d:{}", asDouble());
    case Kind::String:
      return fmt::format("s:\"{}\"", asString());
    case Kind::StringArray: {
      std::string text = "as:[";
      for (std::size_t i = 0; i < asStringArray().size(); ++i) {
        if (i) text += ", ";
        text += fmt::format("\"{}\"", asStringArray()[i]);
      }
      return text + "]";
    }
    case Kind::Struct:
    case Kind::Array: {
      const bool isStruct = kind() == Kind::Struct;
      const auto& values = isStruct ? fields() : elements();
      std::string text = isStruct ? "(" : "a[";
      for (std::size_t i = 0; i < values.size(); ++i) {
        if (i) text += ", ";
        text += values[i].debugDescription();
      }
      return text + (isStruct ? ")" : "]");
    }
  }
  return {};
}

std::string signatureOf(const BusValues& values) {
  std::string signature;
  for (const BusValue& value : values) signature += value.signature();
  return signature;
}

bool isSupportedSignature(std::string_view signature) {
  return splitSignature(signature).has_value();
}

std::optional<std::vector<std::string_view>> splitSignature(std::string_view signature) {
  // D-Bus limits a signature to 255 bytes.
  if (signature.size() > 255) return std::nullopt;
  std::vector<std::string_view> types;
  std::size_t pos = 0;
  while (pos < signature.size()) {
    std::size_t start = pos;
    if (!parseCompleteType(signature, pos, 0)) return std::nullopt;
    types.emplace_back(signature.substr(start, pos - start));
  }
  return types;
}

}  // namespace platform
