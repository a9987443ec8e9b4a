#include "host/Codecs.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdint>
#include <limits>
#include <map>
#include <stdexcept>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include "JsonValue.h"
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::Bytes;
using test::bytesOf;
using test::textOf;

struct Point {
  std::int32_t x;
  std::int32_t y;
};

struct Draft {
  std::string title;
  int revision = 0;
};

void to_json(JsonValue& json, const Draft& draft) { json = {{"title", draft.title}, {"revision", draft.revision}}; }
void from_json(const JsonValue& json, Draft& draft) {
  draft = {json.at("title").get<std::string>(), json.at("revision").get<int>()};
}

enum class Colour : std::uint8_t { Red = 1, Green = 2 };

template <class Codec, class T> void expectSame(const T& value) {
  EXPECT_EQ(Codec::decode(Codec::encode(value)), value);
}

template <class Codec> std::string refusalOf(const Bytes& bytes) {
  try {
    static_cast<void>(Codec::decode(bytes));
  } catch (const std::exception& error) {
    return error.what();
  }
  return "none";
}

TEST(BytesCodec, KeepsBytesAsTheyAre) {
  expectSame<BytesCodec>(Bytes());
  expectSame<BytesCodec>(Bytes{0, 1, 255});
}

TEST(StringCodec, KeepsEveryByteOfAText) {
  expectSame<StringCodec>(std::string());
  expectSame<StringCodec>(std::string("a\0b\xff", 4));
  EXPECT_EQ(StringCodec::encode("hi"), bytesOf("hi"));
}

TEST(TrivialCodec, KeepsNumbersAndEnumerations) {
  expectSame<TrivialCodec<std::int64_t>>(std::numeric_limits<std::int64_t>::min());
  expectSame<TrivialCodec<double>>(-0.1);
  expectSame<TrivialCodec<Colour>>(Colour::Green);
  expectSame<TrivialCodec<bool>>(true);
  expectSame<TrivialCodec<bool>>(false);
  expectSame<TrivialCodec<std::array<char, 3>>>(std::array<char, 3>{'a', 'b', 'c'});
}

TEST(TrivialCodec, KeepsAStructureAsItsMemory) {
  const Bytes bytes = TrivialCodec<Point>::encode({3, -4});
  EXPECT_EQ(bytes.size(), sizeof(Point));
  const Point point = TrivialCodec<Point>::decode(bytes);
  EXPECT_EQ(point.x, 3);
  EXPECT_EQ(point.y, -4);
}

TEST(TrivialCodec, RefusesAnotherNumberOfBytes) {
  EXPECT_EQ(refusalOf<TrivialCodec<std::int32_t>>(Bytes(3)), "3 bytes instead of 4.");
  EXPECT_EQ(refusalOf<TrivialCodec<std::int32_t>>(Bytes(5)), "5 bytes instead of 4.");
  EXPECT_EQ(refusalOf<TrivialCodec<std::int32_t>>(Bytes(4)), "none");
  EXPECT_EQ(refusalOf<TrivialCodec<bool>>(Bytes()), "0 bytes instead of 1.");
}

TEST(TrivialCodec, RefusesATruthThatIsNeither) {
  EXPECT_EQ(refusalOf<TrivialCodec<bool>>({1}), "none");
  EXPECT_EQ(refusalOf<TrivialCodec<bool>>({2}), "Neither true nor false.");
  EXPECT_EQ(refusalOf<TrivialCodec<std::uint8_t>>({2}), "none");
}

TEST(JsonCodec, KeepsWhatCanBeConverted) {
  expectSame<JsonCodec<JsonValue>>(JsonValue{{"a", {1, 2.5, nullptr}}});
  expectSame<JsonCodec<JsonValue>>(JsonValue::array({1}));
  expectSame<JsonCodec<JsonValue>>(JsonValue());
  expectSame<JsonCodec<std::map<std::string, std::vector<int>>>>(
      std::map<std::string, std::vector<int>>{{"a", {1, 2}}, {"b", {}}});
  const Draft draft = JsonCodec<Draft>::decode(JsonCodec<Draft>::encode({"Novel", 7}));
  EXPECT_EQ(draft.title, "Novel");
  EXPECT_EQ(draft.revision, 7);
}

TEST(JsonCodec, WritesText) { EXPECT_EQ(textOf(JsonCodec<std::vector<int>>::encode({1, 2})), "[1,2]"); }

TEST(JsonCodec, SaysWhatItCannotRead) {
  EXPECT_NE(refusalOf<JsonCodec<JsonValue>>(bytesOf("{")).find("parse error"), std::string::npos);
  EXPECT_NE(refusalOf<JsonCodec<JsonValue>>({}).find("unexpected end of input"), std::string::npos);
  EXPECT_NE(refusalOf<JsonCodec<Draft>>(bytesOf("{\"title\":\"x\"}")).find("'revision' not found"), std::string::npos);
  EXPECT_NE(refusalOf<JsonCodec<std::vector<int>>>(bytesOf("7")).find("must be array"), std::string::npos);
}

TEST(JsonCodec, RefusesATextThatIsNotUtf8) {
  EXPECT_THROW(JsonCodec<std::vector<std::string>>::encode({"\xff"}), JsonValue::type_error);
}

TEST(DefaultCodec, FollowsTheType) {
  EXPECT_TRUE((std::is_base_of_v<BytesCodec, DefaultCodec<Bytes>>));
  EXPECT_TRUE((std::is_base_of_v<StringCodec, DefaultCodec<std::string>>));
  EXPECT_TRUE((std::is_base_of_v<TrivialCodec<int>, DefaultCodec<int>>));
  EXPECT_TRUE((std::is_base_of_v<TrivialCodec<Colour>, DefaultCodec<Colour>>));
  EXPECT_TRUE((std::is_base_of_v<JsonCodec<JsonValue>, DefaultCodec<JsonValue>>));
  EXPECT_TRUE((std::is_base_of_v<JsonCodec<Draft>, DefaultCodec<Draft>>));
  EXPECT_TRUE((std::is_base_of_v<JsonCodec<std::vector<Draft>>, DefaultCodec<std::vector<Draft>>>));
}

TEST(DefaultCodec, IsNotThereForWhatRefersToOtherMemory) {
  EXPECT_FALSE(detail::HasJson<std::string_view>::value);
  EXPECT_FALSE(detail::HasJson<const char*>::value);
  EXPECT_FALSE(detail::HasJson<const std::string*>::value);
}

TEST(DefaultCodec, StoresAStructureAsMemoryOnlyWhenAsked) { EXPECT_FALSE(detail::HasJson<Point>::value); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
