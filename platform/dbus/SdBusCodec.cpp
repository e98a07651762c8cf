#include "platform/dbus/SdBusCodec.h"

#include <sdbus-c++/Error.h>

namespace platform::sdbuscodec {
namespace {

Error malformed(std::string_view signature) {
  return Error("BusTransportErrorDomain", 5,
               "message body does not match signature '" + std::string(signature) + "'");
}

template <class T>
bool readBasic(sdbus::Message& message, BusValues& out) {
  T value{};
  message >> value;
  if (!message) return false;
  out.emplace_back(value);
  return true;
}

bool readOne(sdbus::Message& message, std::string_view type, BusValues& out) {
  switch (type.front()) {
    case 'b':
      return readBasic<bool>(message, out);
    case 'i':
      return readBasic<std::int32_t>(message, out);
    case 'u':
      return readBasic<std::uint32_t>(message, out);
    case 'x':
      return readBasic<std::int64_t>(message, out);
    case 'd':
      return readBasic<double>(message, out);
    case 's':
      return readBasic<std::string>(message, out);
    case 'a': {
      if (type[1] == '(') {
        const std::string element(type.substr(1));
        if (!message.enterContainer(element)) return false;
        BusValues elements;
        while (message.enterStruct(element.substr(1, element.size() - 2))) {
          auto types = splitSignature(std::string_view(element).substr(1, element.size() - 2));
          if (!types) return false;
          BusValues fields;
          for (std::string_view field : *types) {
            if (!readOne(message, field, fields)) return false;
          }
          message.exitStruct();
          elements.push_back(BusValue::structure(std::move(fields)));
        }
        message.clearFlags();
        message.exitContainer();
        if (!message) return false;
        out.push_back(BusValue::array(element, std::move(elements)));
        return true;
      }
      if (!message.enterContainer("s")) return false;
      std::vector<std::string> strings;
      while (true) {
        std::string value;
        message >> value;
        if (!message) break;
        strings.push_back(std::move(value));
      }
      message.clearFlags();
      message.exitContainer();
      if (!message) return false;
      out.emplace_back(std::move(strings));
      return true;
    }
    case '(': {
      std::string_view contents = type.substr(1, type.size() - 2);
      if (!message.enterStruct(std::string(contents))) return false;
      auto types = splitSignature(contents);
      if (!types) return false;
      BusValues fields;
      for (std::string_view field : *types) {
        if (!readOne(message, field, fields)) return false;
      }
      message.exitStruct();
      if (!message) return false;
      out.push_back(BusValue::structure(std::move(fields)));
      return true;
    }
    default:
      return false;
  }
}

// `structContents`, when given, is the signature inside a struct's
// parentheses, known from the array that holds it.
void appendOne(sdbus::Message& message, const BusValue& value,
               const std::string* structContents = nullptr) {
  switch (value.kind()) {
    case BusValue::Kind::Bool:
      message << value.asBool();
      break;
    case BusValue::Kind::Int32:
      message << value.asInt32();
      break;
    case BusValue::Kind::UInt32:
      message << value.asUInt32();
      break;
    case BusValue::Kind::Int64:
      message << value.asInt64();
      break;
    case BusValue::Kind::Double:
      message << value.asDouble();
      break;
    case BusValue::Kind::String:
      message << value.asString();
      break;
    case BusValue::Kind::StringArray:
      message.openContainer("s");
      for (const std::string& string : value.asStringArray()) message << string;
      message.closeContainer();
      break;
    case BusValue::Kind::Struct: {
      if (structContents) {
        message.openStruct(*structContents);
      } else {
        std::string signature = value.signature();
        message.openStruct(signature.substr(1, signature.size() - 2));
      }
      for (const BusValue& field : value.fields()) appendOne(message, field);
      message.closeStruct();
      break;
    }
    case BusValue::Kind::Array: {
      // Every element has the array's element signature: worked out once.
      const std::string element = value.signature().substr(1);
      const std::string contents = element.substr(1, element.size() - 2);
      message.openContainer(element);
      for (const BusValue& item : value.elements()) appendOne(message, item, &contents);
      message.closeContainer();
      break;
    }
  }
}

}  // namespace

void appendValues(sdbus::Message& message, const BusValues& values) {
  for (const BusValue& value : values) appendOne(message, value);
}

Result<BusValues> readValues(sdbus::Message& message, std::string_view signature) {
  auto types = splitSignature(signature);
  if (!types) return fail(malformed(signature));
  BusValues values;
  try {
    for (std::string_view type : *types) {
      if (!readOne(message, type, values)) return fail(malformed(signature));
    }
  } catch (const sdbus::Error& error) {
    return fail(Error("BusTransportErrorDomain", 5, error.getName() + ": " + error.getMessage()));
  }
  return values;
}

}  // namespace platform::sdbuscodec
