/// Drawing one scanline of a scene at a given frame.
///
/// Scene coordinates are pixels of the scene's own size; an image of another
/// size is the same picture scaled. The frame value places the ball on its
/// path: the scene's startframe is the path's start, its endframe the path's
/// end, so a range cut into pieces and rendered on different hosts still
/// makes one continuous motion.
#pragma once

#include <cstdint>

#include "tools/frame_painter/scene.h"

/// Paints row `y` of a `width` x `height` image of `scene` at `frame` into
/// `rgb` (3 * width bytes) and, when `matte` is not null, the ball's coverage
/// into `matte` (width bytes, 255 = fully covered). `stamp` is drawn in the
/// top left corner in a small digit font (digits, '.', '-'; other
/// characters are skipped). Non-owning pointers, written only.
void paint_row(const Scene& scene, int width, int height, int y, float frame, const char* stamp,
               uint8_t* rgb, uint8_t* matte);
