#include "platform/orientation.h"

#include <array>
#include <utility>

namespace vireo {

namespace {
constexpr std::array<std::pair<Orientation, std::string_view>, 5> kNames{{
    {Orientation::Undefined, "undefined"},
    {Orientation::Normal, "normal"},
    {Orientation::BottomUp, "bottom-up"},
    {Orientation::LeftUp, "left-up"},
    {Orientation::RightUp, "right-up"},
}};
}  // namespace

std::string OrientationService::orientationName(Orientation orientation) {
  for (const auto& [value, name] : kNames)
    if (value == orientation) return std::string(name);
  return "undefined";
}

std::optional<Orientation> OrientationService::orientationFromText(std::string_view text) {
  for (const auto& [value, name] : kNames)
    if (name == text) return value;
  return std::nullopt;
}

}  // namespace vireo
