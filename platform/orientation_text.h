#pragma once

#include <cstdint>
#include <string>

namespace qn {

// The audio framework's orientation texts: 1 "Portrait", 2 "PortraitUpsideDown",
// 3 "LandscapeLeft", 4 "LandscapeRight", 5 "FaceUp", 6 "FaceDown", anything else "Unknown".
// The test double's Orientation gives these; on Linux the values and texts are
// iio-sensor-proxy's (LinuxOrientationText). Thread-safe.
inline std::string OrientationText(std::int32_t orientation) {
  switch (orientation) {
    case 1:
      return "Portrait";
    case 2:
      return "PortraitUpsideDown";
    case 3:
      return "LandscapeLeft";
    case 4:
      return "LandscapeRight";
    case 5:
      return "FaceUp";
    case 6:
      return "FaceDown";
    default:
      return "Unknown";
  }
}

}  // namespace qn
