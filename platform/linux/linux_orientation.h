#pragma once

#include <memory>

#include "platform/orientation.h"

namespace qn {

// Orientation without a sensor: registrations are kept (and replaced and removed as asked)
// but no orientation change is ever reported, so callbacks are never called. Orientation
// texts: 0 "Unknown", 1 "Portrait", 2 "PortraitUpsideDown", 3 "LandscapeLeft",
// 4 "LandscapeRight", 5 "FaceUp", 6 "FaceDown", anything else "Unknown".
// Safe from any thread.
std::shared_ptr<Orientation> NewLinuxOrientation();

// The orientation text table above.
std::string OrientationText(std::int32_t orientation);

}  // namespace qn
