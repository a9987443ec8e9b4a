#pragma once

#include <cstddef>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include <cellar/JsonValue.h>

namespace velmora::mobile::xplat::cellar::host {

namespace detail {
// Whether T itself is known to refer to what it does not contain.
template <class T> constexpr bool kIsReference = std::is_pointer_v<T> || std::is_member_pointer_v<T> ||
                                                 std::is_null_pointer_v<T> || std::is_same_v<T, std::string_view>;
}  // namespace detail

// A codec turns values of a type into bytes and back, for a `TypedStore`. It is any type with these two functions,
// which may be static:
//
//   std::vector<unsigned char> encode(const T& value) const;
//   T decode(const std::vector<unsigned char>& bytes) const;  // throws what says why it cannot read them
//
// The `TypedStore` keeps one codec and calls it on any thread, on several at the same time: a codec with a state of its
// own, an encryption key for example, must permit that. What `encode` returns, also if it is a reference, is read
// before the value can change. `decode` may also take the bytes by value, and keep them; they may be of any origin.

// Bytes as they are.
struct BytesCodec {
  static const std::vector<unsigned char>& encode(const std::vector<unsigned char>& value) { return value; }
  static std::vector<unsigned char> decode(std::vector<unsigned char> bytes) { return bytes; }
};

// The bytes of a text, in whatever encoding it has, zero bytes included.
struct StringCodec {
  static std::vector<unsigned char> encode(std::string_view value) { return {value.begin(), value.end()}; }
  static std::string decode(const std::vector<unsigned char>& bytes) { return {bytes.begin(), bytes.end()}; }
};

// The memory of a value, for numbers, enumerations and structures of them. The bytes have this machine's byte order and
// this program's layout, and padding is stored as it is: a value can be read by programs with the same definition of T
// on the same kind of machine. Decoding checks the number of bytes (`std::invalid_argument`), and of a `bool` its
// value; nothing else. A T that contains a pointer or a view is undefined behaviour when it is read: not all of those
// are refused by the compiler.
template <class T> struct TrivialCodec {
  static_assert(std::is_trivially_copyable_v<T> && std::is_default_constructible_v<T>,
                "TrivialCodec is for types that can be copied as memory; others need a codec of their own.");
  static_assert(!detail::kIsReference<T>,
                "A pointer or a view does not contain what it refers to: store that instead.");

  static std::vector<unsigned char> encode(const T& value) {
    const auto* const memory = reinterpret_cast<const unsigned char*>(std::addressof(value));
    return {memory, memory + sizeof(T)};
  }

  static T decode(const std::vector<unsigned char>& bytes) {
    if (bytes.size() != sizeof(T)) {
      throw std::invalid_argument(std::to_string(bytes.size()) + " bytes instead of " + std::to_string(sizeof(T)) +
                                  ".");
    }
    if (std::is_same_v<T, bool> && bytes.front() > 1) throw std::invalid_argument("Neither true nor false.");
    T value{};
    std::memcpy(static_cast<void*>(std::addressof(value)), bytes.data(), sizeof(T));
    return value;
  }
};

// JSON text, for `JsonValue` and what the JSON library converts to and from it: types with `to_json` and `from_json`,
// and vectors, maps and the like of these. Throws what the JSON library throws: when encoding, for a text that is not
// UTF-8. Numbers that are not finite become null. A T with views in it, as a vector of `std::string_view`, refers to
// memory that is gone once it is read.
template <class T> struct JsonCodec {
  static_assert(!detail::kIsReference<T>,
                "A pointer or a view does not contain what it refers to: store that instead.");

  static std::vector<unsigned char> encode(const T& value) {
    if constexpr (std::is_same_v<T, JsonValue>) {
      return StringCodec::encode(value.dump());
    } else {
      return StringCodec::encode(JsonValue(value).dump());
    }
  }

  static T decode(const std::vector<unsigned char>& bytes) {
    JsonValue json = JsonValue::parse(bytes.begin(), bytes.end());
    if constexpr (std::is_same_v<T, JsonValue>) {
      return json;
    } else {
      return json.template get<T>();
    }
  }
};

namespace detail {

template <class T, class = void> struct HasJson : std::false_type {};
template <class T> struct HasJson<T, std::void_t<decltype(std::declval<const JsonValue&>().template get<T>())>>
    : std::bool_constant<std::is_constructible_v<JsonValue, const T&> && !kIsReference<T>> {};

template <class T> struct NoCodec {
  static_assert(!std::is_same_v<T, T>,
                "This type does not have a default codec. Name one, TypedStore<T, MyCodec>; or specialise "
                "DefaultCodec<T>; or give T the functions to_json and from_json; or, if T can be copied as memory, "
                "use TrivialCodec<T>.");
};

template <class T> auto defaultCodec() {
  if constexpr (std::is_same_v<T, std::vector<unsigned char>>) {
    return BytesCodec();
  } else if constexpr (std::is_same_v<T, std::string>) {
    return StringCodec();
  } else if constexpr (std::is_arithmetic_v<T> || std::is_enum_v<T>) {
    return TrivialCodec<T>();
  } else if constexpr (HasJson<T>::value) {
    return JsonCodec<T>();
  } else {
    return NoCodec<T>();
  }
}

}  // namespace detail

// The codec that a `TypedStore` has when none is named: `BytesCodec`, `StringCodec`, `TrivialCodec` for numbers and
// enumerations, or `JsonCodec` for what can be converted to JSON. For a type of your own you may specialise it. A
// structure is not stored as memory unless you say so with `TrivialCodec`.
template <class T> struct DefaultCodec : decltype(detail::defaultCodec<T>()) {};

}  // namespace velmora::mobile::xplat::cellar::host
