// The IPC codec: STWValue to and from MessagePack.
//
// Both ends of the request channel use it, the daemon on bytes from any local process, so
// decoding treats its input as hostile: every declared length and count is checked
// against the bytes that are actually there before anything is allocated, nesting is
// bounded, and a broken object is refused as a whole rather than read in part.
//
// Mapping: nil, bool, str (UTF-8 without NUL, the only strings the daemon deals in), bin
// (data), array, map with string keys (dictionary), integers (non-negative ones read as
// unsigned), float32/float64 (real), ext type 1 of 16 bytes (UUID), ext type -1 (the
// standard timestamp, any of its three forms: date). Any other ext, or one of those two
// types with a malformed payload, reads as nil: a value of a type the receiver does not
// know reads as absent. A map that repeats a key is refused, so that sender and receiver
// can never disagree about which of the two values counts.
#pragma once

#include "common/STWValue.h"

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

// Containers nested deeper than this are refused.
inline constexpr size_t STWMessagePackMaxDepth = 64;
// Objects (values, keys and containers) in one decoded object, a bound on the memory a
// hostile message can make the receiver spend beyond its own size. Each decoded object
// costs some tens of bytes more than its encoding (a nil is one byte on the wire), so a
// receiver that takes messages from many peers at once passes a lower limit of its own.
inline constexpr size_t STWMessagePackMaxObjects = 1u << 20;

// Encodes a value as MessagePack.
std::string STWMessagePackEncode(const STWValue& value);
// Append the encoding to `out`, for callers that put it inside a larger message; the
// dictionary form spares wrapping a message body in an STWValue, which would copy it.
void STWMessagePackAppend(std::string& out, const STWValue& value);
void STWMessagePackAppendDictionary(std::string& out, const STWValue::Dictionary& dictionary);

// Decodes exactly one MessagePack object that fills `bytes`. nullopt on broken input,
// trailing bytes, or limits exceeded (more than `maxObjects` objects); `reason`
// (optional) gets a short explanation. The limit is checked before anything is
// allocated.
std::optional<STWValue> STWMessagePackDecode(std::string_view bytes, std::string* reason,
                                             size_t maxObjects = STWMessagePackMaxObjects);
