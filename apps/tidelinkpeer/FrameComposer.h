// Draws video frames for renders: the same pixels as RenderCompositionFrame (Generators.h), but
// only the window a render asks for, row by row, in BGRA or RGBA, and without the per-pixel work
// where a layer allows it (docs/frames.md, "How a frame is drawn"):
//
// - Nothing under the topmost active layer that covers the window opaquely (the pattern, or an
//   opaque solid or gradient over the whole window) is drawn; a fill-only composition costs one
//   fill of the window.
// - Opaque solids are filled a row at a time and copied to the rows below; the pattern and
//   horizontal gradients compute each column once per frame.
//
// Thread-safe; each thread keeps one scratch row that grows to the widest window it drew, so
// steady rendering allocates nothing.
#pragma once

#include <cstddef>
#include <cstdint>

#include "ProjectModel.h"
#include "RenderRules.h"

namespace tidelink::peer {

// Draws the window of |geometry| of |comp| at |time| into |out| (rows |rowBytes| apart, at least
// geometry.width * 4 bytes each). The bytes equal those of RenderCompositionFrame into a
// geometry.frameWidth x geometry.frameHeight view cropped to the window, with the first and third
// byte of each pixel swapped for RGBA. For an interlaced field type, the first field's rows (the
// even rows of the drawn frame for UpperFirst, the odd rows for LowerFirst) show |time| and the
// other rows |time| plus half a frame. Throws RenderError when that later time cannot be
// represented.
void ComposeFrame(const Composition& comp, const Rational& time, const FrameGeometry& geometry, uint8_t* out,
                  size_t rowBytes);

// The time the second field of an interlaced frame at |time| shows: half a frame later.
Rational SecondFieldTime(const Rational& frameRate, const Rational& time);

}  // namespace tidelink::peer
