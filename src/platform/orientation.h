// The audio orientation service: how the device is held (from the accelerometer)
// and how the user interface is turned (reported by the shell). Handlers are
// registered under a text identifier; registering again under the same identifier
// replaces the handler. Handlers run on the service's own thread.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace vireo {

enum class Orientation { Undefined, Normal, BottomUp, LeftUp, RightUp };

using OrientationHandler = std::function<void(Orientation)>;

class OrientationService {
 public:
  virtual ~OrientationService() = default;
  virtual void registerDeviceOrientationHandler(const std::string& identifier, OrientationHandler handler) = 0;
  virtual void registerInterfaceOrientationHandler(const std::string& identifier, OrientationHandler handler) = 0;
  virtual void unregisterDeviceOrientationHandler(const std::string& identifier) = 0;
  virtual void unregisterInterfaceOrientationHandler(const std::string& identifier) = 0;
  // The orientation's text: "normal", "bottom-up", "left-up", "right-up", "undefined".
  virtual std::string orientationText(Orientation orientation) const { return orientationName(orientation); }

  static std::string orientationName(Orientation orientation);
  // The orientation a text names; nothing for any other text.
  static std::optional<Orientation> orientationFromText(std::string_view text);
};

}  // namespace vireo
