/// The scene of the demo renderer: a gradient sky, boxes, and a ball that
/// bounces along a path over the scene's frame range.
///
/// A scene is plain text of statements `key = value;`, one to a line, with
/// '#' starting a comment. The queue reads some of the same keys straight
/// from the file (animation, startframe, endframe, byframe, start_extension,
/// by_extension, extensionsize, fields, odd, even) by searching each line for
/// the key text, so those keys must stand on lines of their own, and no other
/// key, value or comment may contain one of those words followed later on the
/// line by '='. Unknown keys are ignored: a scene may carry settings for other
/// programs.
#pragma once

#include <string>
#include <vector>

struct Rgb {
  float r = 0, g = 0, b = 0;  // 0..255
};

struct Box {
  float x = 0, y = 0, w = 0, h = 0;
  Rgb colour;
};

struct Scene {
  // Keys the queue reads too.
  bool animation = false;
  float startframe = 1.0f, endframe = 1.0f, byframe = 1.0f;
  bool has_start_extension = false;
  int start_extension = 0, by_extension = 1, extensionsize = 1;
  bool fields = false, odd = false, even = false;

  // Drawing keys.
  int width = 160, height = 120;  // "size = WxH;"
  Rgb sky_top{30, 60, 140};
  Rgb sky_bottom{250, 170, 90};
  Rgb ball_colour{250, 220, 40};
  float ball_radius = 12.0f;
  // Start and end point of the ball's path over startframe..endframe.
  float path_x0 = 20, path_y0 = 80, path_x1 = 140, path_y1 = 80;
  float bounce = 40.0f;  // height of each hop, pixels
  float hops = 3.0f;     // hops over the whole range
  std::vector<Box> boxes;
};

/// Parses scene text into `scene` (which keeps its values for keys the text
/// does not set). Returns true, or false with a message naming the line in
/// `error`.
[[nodiscard]] bool scene_parse(const std::string& text, Scene* scene, std::string* error);

/// Reads and parses the scene file at `path`; false with a message in
/// `error` when it cannot be read or does not parse.
[[nodiscard]] bool scene_load(const std::string& path, Scene* scene, std::string* error);

/// Parses "WxH" (each side 1..4096); false when malformed.
[[nodiscard]] bool parse_size(const std::string& text, int* width, int* height);
