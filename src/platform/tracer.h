// Low-cost trace events: a fixed 32-bit code with four zero arguments.
#pragma once

#include <cstdint>

namespace vireo {

namespace trace {
inline constexpr std::uint32_t kServerCreate = 0x21042814;
inline constexpr std::uint32_t kServerStart = 0x21042818;
inline constexpr std::uint32_t kServerStop = 0x2104281C;
inline constexpr std::uint32_t kServerDestroy = 0x21042820;
inline constexpr std::uint32_t kServerSend = 0x21042824;
inline constexpr std::uint32_t kSessionCreate = 0x21042828;
inline constexpr std::uint32_t kSessionStart = 0x2104282C;
inline constexpr std::uint32_t kSessionStop = 0x21042830;
inline constexpr std::uint32_t kSessionDestroy = 0x21042834;
inline constexpr std::uint32_t kSessionSend = 0x21042838;
}  // namespace trace

class Tracer {
 public:
  virtual ~Tracer() = default;
  virtual void emit(std::uint32_t code) = 0;
};

}  // namespace vireo
