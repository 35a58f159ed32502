// Owning handles for sd-bus objects and sd_bus_error. sd-bus objects are not
// thread-safe: a handle, like the object it owns, belongs to the bus thread.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <string>
#include <utility>

namespace vireo::dbus {

// A counted reference: copying takes another reference.
template <typename T, T* (*RefFn)(T*), T* (*UnrefFn)(T*)>
class Ref {
 public:
  Ref() noexcept = default;
  Ref(const Ref& o) noexcept : p_(o.p_ ? RefFn(o.p_) : nullptr) {}
  Ref(Ref&& o) noexcept : p_(std::exchange(o.p_, nullptr)) {}
  Ref& operator=(Ref o) noexcept {
    std::swap(p_, o.p_);
    return *this;
  }
  ~Ref() { reset(); }

  T* get() const noexcept { return p_; }
  T** out() noexcept {
    reset();
    return &p_;
  }
  void reset() noexcept {
    if (p_) UnrefFn(std::exchange(p_, nullptr));
  }
  explicit operator bool() const noexcept { return p_ != nullptr; }

 private:
  T* p_ = nullptr;
};

using MessageRef = Ref<sd_bus_message, sd_bus_message_ref, sd_bus_message_unref>;
using SlotRef = Ref<sd_bus_slot, sd_bus_slot_ref, sd_bus_slot_unref>;
using EventRef = Ref<sd_event, sd_event_ref, sd_event_unref>;
using EventSourceRef = Ref<sd_event_source, sd_event_source_ref, sd_event_source_unref>;
// Closing flushes queued messages first, so replies already sent leave the process.
using BusRef = Ref<sd_bus, sd_bus_ref, sd_bus_flush_close_unref>;

// An sd_bus_error that frees itself.
class BusError {
 public:
  BusError() noexcept = default;
  BusError(const BusError&) = delete;
  BusError& operator=(const BusError&) = delete;
  ~BusError() { sd_bus_error_free(&e_); }

  sd_bus_error* get() noexcept { return &e_; }
  const char* name() const noexcept { return e_.name ? e_.name : ""; }
  const char* message() const noexcept { return e_.message ? e_.message : ""; }

 private:
  sd_bus_error e_ = SD_BUS_ERROR_NULL;
};

inline constexpr const char* kInvalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";

}  // namespace vireo::dbus
