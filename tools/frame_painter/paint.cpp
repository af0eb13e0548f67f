#include "tools/frame_painter/paint.h"

#include <cmath>
#include <cstring>

namespace {

constexpr float kPi = 3.14159265358979f;

// 3x5 glyphs, one row of three bits per entry, top row first.
struct Glyph {
  char c;
  uint8_t rows[5];
};
constexpr Glyph kFont[] = {
    {'0', {7, 5, 5, 5, 7}}, {'1', {2, 6, 2, 2, 7}}, {'2', {7, 1, 7, 4, 7}}, {'3', {7, 1, 7, 1, 7}},
    {'4', {5, 5, 7, 1, 1}}, {'5', {7, 4, 7, 1, 7}}, {'6', {7, 4, 7, 5, 7}}, {'7', {7, 1, 1, 1, 1}},
    {'8', {7, 5, 7, 5, 7}}, {'9', {7, 5, 7, 1, 7}}, {'.', {0, 0, 0, 0, 2}}, {'-', {0, 0, 7, 0, 0}},
};
constexpr int kStampScale = 2;
constexpr int kStampMargin = 2;

const Glyph* glyph(char c) {
  for (const Glyph& g : kFont)
    if (g.c == c) return &g;
  return nullptr;
}

// Whether pixel (x, y) of the image lies on a lit dot of the stamp.
bool stamp_lit(const char* stamp, int x, int y) {
  int gy = (y - kStampMargin) / kStampScale;
  if (y < kStampMargin || gy >= 5 || x < kStampMargin) return false;
  int cell = (x - kStampMargin) / kStampScale;  // glyph column, 4 cells a glyph
  int index = cell / 4;
  int gx = cell % 4;
  if (gx == 3) return false;  // spacing between glyphs
  int drawn = 0;
  for (const char* p = stamp; *p; p++) {
    const Glyph* g = glyph(*p);
    if (!g) continue;
    if (drawn++ == index) return (g->rows[gy] >> (2 - gx)) & 1;
  }
  return false;
}

float clamp01(float v) { return v < 0 ? 0 : (v > 1 ? 1 : v); }

uint8_t to_byte(float v) {
  if (v <= 0) return 0;
  if (v >= 255) return 255;
  return static_cast<uint8_t>(std::lround(v));
}

}  // namespace

void paint_row(const Scene& scene, int width, int height, int y, float frame, const char* stamp,
               uint8_t* rgb, uint8_t* matte) {
  float sx = static_cast<float>(scene.width) / static_cast<float>(width);
  float sy = static_cast<float>(scene.height) / static_cast<float>(height);
  // Pixel centres, in scene coordinates.
  float py = (static_cast<float>(y) + 0.5f) * sy;

  float span = scene.endframe - scene.startframe;
  float t = span > 0 ? (frame - scene.startframe) / span : 0.0f;
  float bx = scene.path_x0 + (scene.path_x1 - scene.path_x0) * t;
  float by = scene.path_y0 + (scene.path_y1 - scene.path_y0) * t -
             scene.bounce * std::fabs(std::sin(kPi * scene.hops * t));
  float r = scene.ball_radius;

  float g = height > 1 ? static_cast<float>(y) / static_cast<float>(height - 1) : 0.0f;
  Rgb sky{scene.sky_top.r + (scene.sky_bottom.r - scene.sky_top.r) * g,
          scene.sky_top.g + (scene.sky_bottom.g - scene.sky_top.g) * g,
          scene.sky_top.b + (scene.sky_bottom.b - scene.sky_top.b) * g};

  for (int x = 0; x < width; x++) {
    float px = (static_cast<float>(x) + 0.5f) * sx;
    Rgb c = sky;
    for (const Box& box : scene.boxes)
      if (px >= box.x && px < box.x + box.w && py >= box.y && py < box.y + box.h) c = box.colour;

    float dx = px - bx, dy = py - by;
    float dist = std::sqrt(dx * dx + dy * dy);
    // One pixel of soft edge, measured in image pixels, so small images
    // keep a round ball.
    float cover = clamp01((r - dist) / sx + 0.5f);
    if (cover > 0) {
      // Lit from the upper left.
      float shade = 0.8f - 0.35f * (dx + dy) / (r * 1.4142f);
      Rgb ball{scene.ball_colour.r * shade, scene.ball_colour.g * shade,
               scene.ball_colour.b * shade};
      c = Rgb{c.r + (ball.r - c.r) * cover, c.g + (ball.g - c.g) * cover,
              c.b + (ball.b - c.b) * cover};
    }
    if (stamp && stamp_lit(stamp, x, y)) c = Rgb{255, 255, 255};

    rgb[3 * x] = to_byte(c.r);
    rgb[3 * x + 1] = to_byte(c.g);
    rgb[3 * x + 2] = to_byte(c.b);
    if (matte) matte[x] = to_byte(cover * 255.0f);
  }
}
