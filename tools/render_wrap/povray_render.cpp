// povray_render: renders a job's frames with POV-Ray 3.7.
//
// One POV-Ray run per frame, into a private hidden directory beside the
// job's images (POV-Ray numbers an animation's files by itself, with as many
// digits as its final frame has); the one image it wrote is then moved to
// the name the daemon expects (PIX.<extension>).  A scene given as an .ini
// keeps its own animation settings and renders the frame as a subset
// (+SF/+EF), so its clock runs as the .ini says; a .pov scene renders the
// frame as a one-frame animation (+KFI/+KFF), which sets frame_number.
// POV-Ray's carriage-return progress ("Rendered N of M pixels") becomes the
// daemon's progress lines; its error lines ("Parse Error: ...") go to the
// output as they are, where the daemon finds them.

#include <dirent.h>
#include <stdlib.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "tools/render_wrap/render_wrap.h"

namespace {

constexpr const char* kUsage =
    "usage: povray_render -p PIX [-m MATTE] [-A] [-s START -e END -b BY]\n"
    "                     [-S FIRSTEXT -B EXTSTEP] [-E EXTSIZE] [-V] [-nN]\n"
    "                     [\"OPTIONS\"] SCENE.ini|SCENE.pov\n"
    "       povray_render -h | --help\n"
    "\n"
    "Renders the frames START, START+BY, ... up to END of the scene with\n"
    "POV-Ray, one run per frame, as PNG files named PIX.<extension>: FIRSTEXT +\n"
    "i*EXTSTEP for the i-th frame (from 0) with -S, else the frame number,\n"
    "zero-padded to EXTSIZE digits.  An .ini scene keeps its own animation\n"
    "options (Initial_Frame, Final_Frame, clocks) and each frame is rendered\n"
    "as the subset +SF<frame> +EF<frame>; a .pov scene gets +KFI<frame>\n"
    "+KFF<frame> (its frame_number is the frame).  Without -s one image is\n"
    "rendered to PIX.  Frames must be whole numbers.  -nN renders with N\n"
    "threads (+WT); -A, -V and -m MATTE are accepted and unused.\n"
    "\n"
    "OPTIONS: blank-separated POV-Ray options added to each run (for example\n"
    "\"+W320 +H240 +A0.3\").\n"
    "\n"
    "Progress goes to stderr as \"<image> r <pixels done + 2> of <pixels>\",\n"
    "errors to stdout.\n"
    "\n"
    "Environment:\n"
    "  POVRAY  the POV-Ray program (default: povray, found through PATH)\n"
    "\n"
    "Exit status: 0 when every frame was written, 1 when one was not, 2 on a\n"
    "usage error.\n";

bool ends_with(const std::string& s, const char* tail) {
  size_t n = strlen(tail);
  return s.size() >= n && strcasecmp(s.c_str() + s.size() - n, tail) == 0;
}

bool reports_trouble(const std::string& line) {
  return line.find("Error") != std::string::npos || line.find(" error") != std::string::npos ||
         line.find("Warning:") != std::string::npos || line.find("failed") != std::string::npos ||
         line.find("Failed") != std::string::npos || line.find("Problem with") != std::string::npos;
}

// A hidden directory beside the images, removed with whatever is left in it.
struct ScratchDir {
  std::string path;
  ~ScratchDir() {
    if (path.empty()) return;
    if (DIR* d = opendir(path.c_str())) {
      while (dirent* e = readdir(d))
        if (e->d_name[0] != '.') unlink((path + "/" + e->d_name).c_str());
      closedir(d);
    }
    rmdir(path.c_str());
  }
};

// The one file POV-Ray wrote into the scratch directory ("" when none).
std::string only_file(const std::string& dir) {
  std::string found;
  if (DIR* d = opendir(dir.c_str())) {
    while (dirent* e = readdir(d))
      if (e->d_name[0] != '.') found = dir + "/" + e->d_name;
    closedir(d);
  }
  return found;
}

}  // namespace

int main(int argc, char** argv) {
  RwArgs args;
  std::vector<RwFrame> frames;
  if (int status = Rw_start(argc, argv, kUsage, &args, &frames); status >= 0) return status;
  size_t slash = args.pix.rfind('/');
  std::string dir = slash == std::string::npos ? "." : args.pix.substr(0, slash);
  std::string base = slash == std::string::npos ? args.pix : args.pix.substr(slash + 1);
  ScratchDir scratch;
  std::string tmpl = dir + "/." + base + ".povXXXXXX";
  std::vector<char> name(tmpl.begin(), tmpl.end());
  name.push_back('\0');
  if (mkdtemp(name.data()) == nullptr) {
    Rw_error("povray_render: cannot make a directory beside \"%s\": %s", args.pix.c_str(),
             strerror(errno));
    return 1;
  }
  scratch.path = name.data();

  bool ini = ends_with(args.scene, ".ini");
  Rw_note("povray_render: %zu frame%s of \"%s\"", frames.size(), frames.size() == 1 ? "" : "s",
          args.scene.c_str());
  for (const RwFrame& f : frames) {
    if (args.animate && f.frame != static_cast<float>(static_cast<int>(f.frame))) {
      Rw_error("povray_render: POV-Ray renders whole frames only, not frame %g", f.frame);
      return 1;
    }
    std::vector<std::string> cmd = {Rw_program("POVRAY", "povray")};
    cmd.push_back(ini ? args.scene : "+I" + args.scene);
    // The renderer starts in the project directory: what the scene names
    // (its .pov, its includes) is looked for beside the scene too.
    size_t scene_slash = args.scene.rfind('/');
    if (scene_slash != std::string::npos) cmd.push_back("+L" + args.scene.substr(0, scene_slash));
    cmd.insert(cmd.end(), {"+O" + scratch.path + "/frame.png", "+FN", "-D", "-P"});
    if (args.animate) {
      std::string n = std::to_string(static_cast<int>(f.frame));
      if (ini) {
        cmd.insert(cmd.end(), {"+SF" + n, "+EF" + n});
      } else {
        cmd.insert(cmd.end(), {"+KFI" + n, "+KFF" + n});
      }
    }
    if (args.processors > 0) cmd.push_back("+WT" + std::to_string(args.processors));
    for (const std::string& w : Rw_words(args.options)) cmd.push_back(w);

    int total = 0;
    int status = Rw_run(cmd, [&](const std::string& line) {
      int done = 0, all = 0;
      if (sscanf(line.c_str(), "Rendered %d of %d pixels", &done, &all) == 2 && all > 0) {
        Rw_progress(f.image, done, all);
        total = all;
      } else if (reports_trouble(line)) {
        // An .ini that cannot be read is "Problem with option setting",
        // which the daemon would not take for an error.
        if (line.find("Problem with") != std::string::npos) {
          Rw_error("%s (scene \"%s\")", line.c_str(), args.scene.c_str());
        } else {
          Rw_note("%s", line.c_str());
        }
      }
    });
    if (status == -1) return 1;
    std::string written = only_file(scratch.path);
    if (status != 0 || written.empty()) {
      Rw_error("povray_render: POV-Ray ended with status %d at frame %g", status, f.frame);
      return 1;
    }
    std::string why;
    if (!Rw_move(written, f.image, &why)) {
      Rw_error("povray_render: cannot write image \"%s\": %s", f.image.c_str(), why.c_str());
      return 1;
    }
    if (total > 0) Rw_progress(f.image, total, total);
    Rw_note("wrote %s", f.image.c_str());
  }
  return 0;
}
