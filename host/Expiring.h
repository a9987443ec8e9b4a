#pragma once

#include <chrono>
#include <optional>
#include <type_traits>
#include <utility>
#include <vector>

#include <cellar/Export.h>
#include <cellar/host/Codecs.h>
#include <cellar/host/TypedStore.h>

namespace velmora::mobile::xplat::cellar::host {

namespace detail {

// The bytes behind the magic bytes, the version and the date at which they expire.
CELLAR_EXPORT std::vector<unsigned char> withDeadline(const std::vector<unsigned char>& bytes,
                                                      std::chrono::seconds timeToLive);

// Takes what `withDeadline` has added off the bytes; false when they have expired. Throws `std::invalid_argument` for
// bytes that do not come from there.
CELLAR_EXPORT bool takeDeadline(std::vector<unsigned char>& bytes);

}  // namespace detail

// A codec that gives each value of another codec its own time to live. In a TypedStore it makes `put` take it:
//
//   ExpiringStore<std::string> tokens(host.store<PersistentKeyValueStore>("tokens"));
//   tokens.put("session", "4711", std::chrono::minutes(30));
//
// A value lives while less than its time has passed since `put` was called, in whole seconds of `Clock`: at its
// deadline it has expired. One with a time of 0 or less replaces what is there and has expired at once;
// `std::chrono::seconds::max()` means for ever. A clock that is set back lets a value live longer.
//
// `get` of an expired value is a miss, and removes it; where that fails it is one error line. It removes no newer
// value: not one that is put, by then, through any TypedStore with a time to live over the same store object. What is
// stored meanwhile by other means, with the store's own functions or a TypedStore of another codec, can be removed in
// its place. The store's own limits apply as well: its stale age, capacity and pruning may remove a value earlier.
// Nothing else looks for expired values: what is never asked for stays until then.
//
// A value without a deadline, of another codec for example, fails with `DecodeError`.
//
// Puts, and removals of expired values, of one key are handed to the store one at a time, those of some other keys
// too. Queues of your own that run tasks at once must not do so on several threads, waiting for one another.
template <class Codec> class Expiring {
 public:
  Expiring() = default;
  explicit Expiring(Codec codec) : codec_(std::move(codec)) {}

  template <class T> auto encode(const T& value, std::chrono::seconds timeToLive) const -> std::enable_if_t<
      std::is_convertible_v<decltype(std::declval<const Codec&>().encode(value)), const std::vector<unsigned char>&>,
      std::vector<unsigned char>> {
    return detail::withDeadline(codec_.encode(value), timeToLive);
  }

  // Empty when it has expired.
  std::optional<detail::Decoded<Codec>> decode(std::vector<unsigned char> bytes) const {
    if (!detail::takeDeadline(bytes)) return std::nullopt;
    return std::optional<detail::Decoded<Codec>>(std::in_place, codec_.decode(std::move(bytes)));
  }

 private:
  Codec codec_;
};

template <class T, class Codec = DefaultCodec<T>> using ExpiringStore = TypedStore<T, Expiring<Codec>>;

}  // namespace velmora::mobile::xplat::cellar::host
