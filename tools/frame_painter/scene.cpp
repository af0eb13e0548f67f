#include "tools/frame_painter/scene.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <sstream>

namespace {

constexpr int kMaxSide = 4096;

std::string trim(const std::string& s) {
  size_t b = s.find_first_not_of(" \t\r\n");
  if (b == std::string::npos) return "";
  size_t e = s.find_last_not_of(" \t\r\n");
  return s.substr(b, e - b + 1);
}

// Reads exactly `n` blank-separated numbers; trailing text is an error.
bool parse_floats(const std::string& value, float* out, int n) {
  const char* p = value.c_str();
  for (int i = 0; i < n; i++) {
    char* end = nullptr;
    errno = 0;
    float v = strtof(p, &end);
    if (end == p || errno == ERANGE) return false;
    out[i] = v;
    p = end;
  }
  while (*p == ' ' || *p == '\t') p++;
  return *p == '\0';
}

bool parse_rgb(const std::string& value, Rgb* rgb) {
  float v[3];
  if (!parse_floats(value, v, 3)) return false;
  for (float c : v)
    if (c < 0 || c > 255) return false;
  *rgb = Rgb{v[0], v[1], v[2]};
  return true;
}

// The queue converts these with atof/atoi and takes whatever leads the
// value; doing the same here keeps both sides agreeing on the same file.
float lenient_float(const std::string& value) { return static_cast<float>(atof(value.c_str())); }
int lenient_int(const std::string& value) { return atoi(value.c_str()); }

bool apply(const std::string& key, const std::string& value, Scene* s) {
  if (key == "animation") {
    s->animation = value.find("ON") != std::string::npos;
  } else if (key == "startframe") {
    s->startframe = lenient_float(value);
  } else if (key == "endframe") {
    s->endframe = lenient_float(value);
  } else if (key == "byframe") {
    s->byframe = lenient_float(value);
  } else if (key == "start_extension") {
    s->start_extension = lenient_int(value);
    s->has_start_extension = true;
  } else if (key == "by_extension") {
    s->by_extension = lenient_int(value);
  } else if (key == "extensionsize") {
    s->extensionsize = lenient_int(value);
  } else if (key == "fields") {
    s->fields = value.find("TRUE") != std::string::npos;
  } else if (key == "odd") {
    s->odd = value.find("FALSE") == std::string::npos;
  } else if (key == "even") {
    s->even = value.find("FALSE") == std::string::npos;
  } else if (key == "size") {
    return parse_size(value, &s->width, &s->height);
  } else if (key == "sky_top") {
    return parse_rgb(value, &s->sky_top);
  } else if (key == "sky_bottom") {
    return parse_rgb(value, &s->sky_bottom);
  } else if (key == "ball_colour") {
    return parse_rgb(value, &s->ball_colour);
  } else if (key == "ball_radius") {
    return parse_floats(value, &s->ball_radius, 1) && s->ball_radius > 0;
  } else if (key == "ball_path") {
    float v[4];
    if (!parse_floats(value, v, 4)) return false;
    s->path_x0 = v[0], s->path_y0 = v[1], s->path_x1 = v[2], s->path_y1 = v[3];
  } else if (key == "bounce") {
    return parse_floats(value, &s->bounce, 1);
  } else if (key == "hops") {
    return parse_floats(value, &s->hops, 1) && s->hops >= 0;
  } else if (key == "box") {
    float v[7];
    if (!parse_floats(value, v, 7)) return false;
    Box box{v[0], v[1], v[2], v[3], Rgb{v[4], v[5], v[6]}};
    for (float c : {v[4], v[5], v[6]})
      if (c < 0 || c > 255) return false;
    s->boxes.push_back(box);
  }
  return true;
}

}  // namespace

bool parse_size(const std::string& text, int* width, int* height) {
  int w = 0, h = 0, used = 0;
  if (sscanf(text.c_str(), "%dx%d%n", &w, &h, &used) != 2) return false;
  if (trim(text.substr(static_cast<size_t>(used))) != "") return false;
  if (w < 1 || h < 1 || w > kMaxSide || h > kMaxSide) return false;
  *width = w;
  *height = h;
  return true;
}

bool scene_parse(const std::string& text, Scene* scene, std::string* error) {
  std::istringstream in(text);
  std::string line;
  int number = 0;
  while (std::getline(in, line)) {
    number++;
    size_t hash = line.find('#');
    if (hash != std::string::npos) line.erase(hash);
    // Statements end with ';'; the last one on a line may leave it out.
    size_t start = 0;
    while (start <= line.size()) {
      size_t semi = line.find(';', start);
      std::string stmt = trim(line.substr(start, semi == std::string::npos ? semi : semi - start));
      start = semi == std::string::npos ? line.size() + 1 : semi + 1;
      if (stmt.empty()) continue;
      size_t eq = stmt.find('=');
      if (eq == std::string::npos) {
        *error = "scene line " + std::to_string(number) + ": expected key = value;";
        return false;
      }
      std::string key = trim(stmt.substr(0, eq));
      std::string value = trim(stmt.substr(eq + 1));
      if (!apply(key, value, scene)) {
        *error =
            "scene line " + std::to_string(number) + ": bad value \"" + value + "\" for " + key;
        return false;
      }
    }
  }
  return true;
}

bool scene_load(const std::string& path, Scene* scene, std::string* error) {
  std::unique_ptr<FILE, int (*)(FILE*)> f(fopen(path.c_str(), "re"), fclose);
  if (!f) {
    *error = "cannot read scene \"" + path + "\": " + strerror(errno);
    return false;
  }
  std::string text;
  char buf[4096];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, f.get())) > 0) text.append(buf, n);
  if (ferror(f.get())) {
    *error = "cannot read scene \"" + path + "\": " + strerror(errno);
    return false;
  }
  return scene_parse(text, scene, error);
}
