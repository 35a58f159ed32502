// Property-list values to and from D-Bus messages.
//
// Reading takes one complete value of any signature at the message's read
// position. Strings, object paths and signatures become strings; integers keep
// their signedness (y q u t unsigned, n i x signed); ay becomes data; a{..} a
// dictionary; other arrays and structs arrays; variants are unwrapped. File
// descriptors and values nested deeper than kMaxContainerDepth are refused with
// org.freedesktop.DBus.Error.InvalidArgs, because a client must not be able to
// make the daemon recurse without bound or hold its descriptors.
//
// Readers also take DecodeLimits, which bound what one value may make the daemon
// hold; passing a limit stops reading at once and fails with
// org.freedesktop.DBus.Error.LimitsExceeded naming the limit.
//
// Writing puts a value into a message as a variant: Int x, UInt t, Bool b,
// Double d, String s, Data ay, Array av, a dictionary with string keys a{sv}, with
// keys of another kind a{xv} a{tv} a{bv} a{dv} (by the first key's kind), and with
// mixed key kinds av of (vv) pairs.
#pragma once

#include <systemd/sd-bus.h>

#include <cstddef>
#include <limits>

#include "base/value.h"

namespace vireo::dbus {

// Containers (arrays, dictionaries, structs) a value may nest; variants do not count.
inline constexpr int kMaxContainerDepth = 16;

inline constexpr const char* kLimitsExceeded = "org.freedesktop.DBus.Error.LimitsExceeded";

inline constexpr std::size_t kUnlimited = std::numeric_limits<std::size_t>::max();

// What one value may hold, the defaults holding anything. Bytes are the lengths of
// all strings (dictionary keys included) and data plus 8 for every other basic
// value, linear in the message size. Entries count every value: each array element,
// struct field and dictionary value, containers included, the outermost one too;
// dictionary keys are not entries of their own.
struct DecodeLimits {
  std::size_t maxBytes = kUnlimited;    // refused as "payload larger than MaxPayloadBytes=N"
  std::size_t maxEntries = kUnlimited;  // refused as "payload has more than MaxPayloadEntries=N values"
  // The reporter IDs of one SendMessage; refused as "more than MaxReporterIDsPerCall=N reporter IDs".
  std::size_t maxReporterIDs = kUnlimited;
};

// Reads the next complete value, in time linear in its size. Returns >0 on
// success, 0 at the end of the current container, <0 on failure with error set:
// InvalidArgs for refused input, -ENOBUFS with kLimitsExceeded when the value
// passes a limit.
int readValue(sd_bus_message* m, Value* out, sd_bus_error* error, const DecodeLimits& limits = {});

// Reads the next value, which must be a dictionary (a{..}).
int readDictionary(sd_bus_message* m, Dictionary* out, sd_bus_error* error, const DecodeLimits& limits = {});

// Appends value as a variant. Returns <0 (-errno) when sd-bus refuses the
// content (invalid UTF-8, for one) or the value is absent or nested too deep; the
// message is then unusable.
int appendVariant(sd_bus_message* m, const Value& value);

// Appends a dictionary as a{sv}; every key must be a string (-EINVAL otherwise).
int appendStringDictionary(sd_bus_message* m, const Dictionary& dictionary);

}  // namespace vireo::dbus
