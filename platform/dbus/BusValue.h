// BusValue: one argument or reply value of a bus method call, in the small
// subset of D-Bus types the service contract uses: boolean (b), int32 (i),
// uint32 (u), int64 (x), double (d), string (s), array of strings (as),
// structs of those ("(siss)") and arrays of structs ("a(sis)"). A plain value
// type: copyable, comparable, safe to hand between threads like any other
// value.
//
// Asking a value for a kind it does not hold (asString() on an int32) is a
// programming error and throws std::logic_error; code that reads outside
// input checks kind() or signature() first.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace platform {

class BusValue {
 public:
  enum class Kind { Bool, Int32, UInt32, Int64, Double, String, StringArray, Struct, Array };

  // The empty string.
  BusValue() : value_(std::string()) {}
  BusValue(bool value) : value_(value) {}
  BusValue(std::int32_t value) : value_(value) {}
  BusValue(std::uint32_t value) : value_(value) {}
  BusValue(std::int64_t value) : value_(value) {}
  BusValue(double value) : value_(value) {}
  BusValue(std::string value) : value_(std::move(value)) {}
  BusValue(const char* value) : value_(std::string(value)) {}
  BusValue(std::string_view value) : value_(std::string(value)) {}
  BusValue(std::vector<std::string> strings) : value_(std::move(strings)) {}

  // A struct of the given fields, in order. A struct needs at least one field.
  static BusValue structure(std::vector<BusValue> fields);
  // An array of structs of signature `elementSignature` ("(sis)"); every
  // element must have that signature.
  static BusValue array(std::string elementSignature, std::vector<BusValue> elements);

  Kind kind() const { return static_cast<Kind>(value_.index()); }
  // The D-Bus type signature of this one value: "b", "s", "as", "(siss)"...
  std::string signature() const;

  bool asBool() const;
  std::int32_t asInt32() const;
  std::uint32_t asUInt32() const;
  std::int64_t asInt64() const;
  double asDouble() const;
  const std::string& asString() const;
  const std::vector<std::string>& asStringArray() const;
  const std::vector<BusValue>& fields() const;
  const std::vector<BusValue>& elements() const;

  // A text for logs and test failures: 's:"abc"', '(i:1, s:"x")'.
  std::string debugDescription() const;

  friend bool operator==(const BusValue& a, const BusValue& b) { return a.value_ == b.value_; }

 private:
  struct StructFields {
    std::vector<BusValue> fields;
    friend bool operator==(const StructFields&, const StructFields&) = default;
  };
  struct ArrayElements {
    std::string elementSignature;
    std::vector<BusValue> elements;
    friend bool operator==(const ArrayElements&, const ArrayElements&) = default;
  };
  using Storage = std::variant<bool, std::int32_t, std::uint32_t, std::int64_t, double, std::string,
                               std::vector<std::string>, StructFields, ArrayElements>;
  explicit BusValue(StructFields fields) : value_(std::move(fields)) {}
  explicit BusValue(ArrayElements elements) : value_(std::move(elements)) {}

  Storage value_;
};

using BusValues = std::vector<BusValue>;

// The concatenated signatures of `values`: the signature of a whole message
// body ("sb" for a string and a boolean, "" for none).
std::string signatureOf(const BusValues& values);

// Whether `signature` is a sequence of complete types that BusValue can hold
// (b, i, u, x, d, s, as, non-empty structs of these nested at most 32 deep,
// and arrays of such structs). The empty signature is valid: no values.
bool isSupportedSignature(std::string_view signature);

// Splits a valid signature into its complete types: "s(siss)b" ->
// {"s", "(siss)", "b"}, views into `signature`. Nothing when the signature
// is not supported.
std::optional<std::vector<std::string_view>> splitSignature(std::string_view signature);

}  // namespace platform
