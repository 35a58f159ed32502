// Trace events as USDT probes: provider "vireo", probe "event", the code and four zeros.
#pragma once

#include "platform/tracer.h"

namespace vireo::linux_platform {

class UsdtTracer : public Tracer {
 public:
  void emit(std::uint32_t code) override;
};

}  // namespace vireo::linux_platform
