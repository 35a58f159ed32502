#include "platform/linux/usdt_tracer.h"

#include <sys/sdt.h>

namespace vireo::linux_platform {

void UsdtTracer::emit(std::uint32_t code) {
  // Five 64-bit arguments, so every consumer reads the same layout.
  std::uint64_t event = code;
  std::uint64_t zero = 0;
  DTRACE_PROBE5(vireo, event, event, zero, zero, zero, zero);
}

}  // namespace vireo::linux_platform
