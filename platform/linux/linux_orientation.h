#pragma once

#include <memory>

#include "platform/orientation.h"

namespace qn {

// Orientation without a sensor: registrations are kept (and replaced and removed as asked)
// but no orientation change is ever reported, so callbacks are never called. Orientation
// texts as OrientationText (platform/orientation_text.h) gives them. Safe from any thread.
std::shared_ptr<Orientation> NewLinuxOrientation();

}  // namespace qn
