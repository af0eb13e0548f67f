// blender_render: renders a job's frames with Blender in the background.
//
// One Blender run renders the task's frames (-s/-e/-j, then -a) into hidden
// files beside the job's images; each image Blender reports as saved is
// renamed at once to the name the daemon expects (PIX.<extension>), so that a
// run that dies leaves every finished frame in place.  Blender's own lines
// become the daemon's progress ("Fra:N ... Sample k/n") and error lines (its
// "Error: ..." lines are copied as they are).  A run killed hard (the daemon
// kills the whole process group) may leave one hidden ".PIX.blend<pid>.*"
// file behind; the next run does not reuse it.

#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "tools/render_wrap/render_wrap.h"

namespace {

constexpr const char* kUsage =
    "usage: blender_render -p PIX [-m MATTE] [-A] [-s START -e END -b BY]\n"
    "                      [-S FIRSTEXT -B EXTSTEP] [-E EXTSIZE] [-V] [-nN]\n"
    "                      [\"OPTIONS\"] SCENE.blend\n"
    "       blender_render -h | --help\n"
    "\n"
    "Renders the frames START, START+BY, ... up to END of SCENE.blend with\n"
    "Blender in the background, as PNG files named PIX.<extension>: FIRSTEXT +\n"
    "i*EXTSTEP for the i-th frame (from 0) with -S, else the frame number,\n"
    "zero-padded to EXTSIZE digits.  Without -s the scene's start frame is\n"
    "rendered to PIX.  Frames must be whole numbers.  Denoising is turned off\n"
    "for the render (Debian's Blender is built without OpenImageDenoise).\n"
    "-nN renders with N threads; -A, -V and -m MATTE are accepted and unused.\n"
    "\n"
    "OPTIONS: blank-separated words handed to Blender after the scene, before\n"
    "the frame options (for example \"-t 2\" or \"--engine CYCLES\").\n"
    "\n"
    "Progress goes to stderr as \"<image> r <samples done + 2> of <samples>\",\n"
    "errors to stdout as \"Error: ...\".\n"
    "\n"
    "Environment:\n"
    "  BLENDER  the Blender program (default: blender, found through PATH)\n"
    "\n"
    "Exit status: 0 when every frame was written, 1 when one was not, 2 on a\n"
    "usage error.\n";

// Debian's Blender has no OpenImageDenoise: a scene that asks for denoising
// fails every frame with "Build without OpenImageDenoiser".
constexpr const char* kDenoiseOff =
    "import bpy\n"
    "for s in bpy.data.scenes:\n"
    "    if getattr(s, 'cycles', None) is not None and s.cycles.use_denoising:\n"
    "        print('blender_render: denoising was on in scene', repr(s.name))\n"
    "        s.cycles.use_denoising = False\n"
    "    for v in s.view_layers:\n"
    "        if getattr(v, 'cycles', None) is not None:\n"
    "            v.cycles.use_denoising = False\n";

std::string directory_of(const std::string& path) {
  size_t slash = path.rfind('/');
  return slash == std::string::npos ? "." : path.substr(0, slash);
}

std::string base_of(const std::string& path) {
  size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

// "Sample k/n" in a Cycles (or Eevee) status line.
bool samples_of(const std::string& line, int* done, int* total) {
  size_t at = line.rfind("Sample ");
  return at != std::string::npos && sscanf(line.c_str() + at, "Sample %d/%d", done, total) == 2 &&
         *total > 0;
}

// Blender's command line: one run for all the task's frames, each saved to
// a hidden name that the run's lines then map to the daemon's name.
std::vector<std::string> blender_command(const RwArgs& args, const std::vector<RwFrame>& frames) {
  std::vector<std::string> cmd = {Rw_program("BLENDER", "blender"), "-b", args.scene,
                                  "--python-expr", kDenoiseOff};
  if (args.processors > 0) {
    cmd.push_back("-t");
    cmd.push_back(std::to_string(args.processors));
  }
  for (const std::string& w : Rw_words(args.options)) cmd.push_back(w);
  char hidden[64];
  snprintf(hidden, sizeof hidden, ".blend%d.####", static_cast<int>(getpid()));
  cmd.insert(cmd.end(), {"-o", directory_of(args.pix) + "/." + base_of(args.pix) + hidden, "-F",
                         "PNG", "-x", "1"});
  if (args.animate) {
    int by = static_cast<int>(args.by) > 0 ? static_cast<int>(args.by) : 1;
    cmd.insert(cmd.end(), {"-s", std::to_string(static_cast<int>(frames.front().frame)), "-e",
                           std::to_string(static_cast<int>(frames.back().frame)), "-j",
                           std::to_string(by), "-a"});
  } else {
    cmd.insert(cmd.end(), {"-f", "+0"});
  }
  return cmd;
}

// Follows one Blender run's lines: progress, saved images, failures.
struct BlenderRun {
  const RwArgs& args;
  const std::vector<RwFrame>& frames;
  size_t saved = 0;
  int current = 0;  // Blender's frame number of the lines now coming
  int last_total = 1;
  bool failed = false;

  const RwFrame* image_of(int blender_frame) const {
    if (!args.animate) return &frames.front();
    for (const RwFrame& f : frames)
      if (static_cast<int>(f.frame) == blender_frame) return &f;
    return nullptr;
  }

  void status_line(const std::string& line) {
    current = atoi(line.c_str() + 4);
    int done = 0, total = 0;
    const RwFrame* f = image_of(current);
    if (f != nullptr && samples_of(line, &done, &total)) {
      Rw_progress(f->image, done, total);
      last_total = total;
    }
    // Blender's own failures come inside its status lines too.
    if (line.find("| Error") != std::string::npos ||
        line.find("OpenImageDenoiser") != std::string::npos)
      Rw_note("%s", line.c_str());
  }

  void saved_line(const std::string& line) {
    std::string path = line.substr(8, line.rfind('\'') - 8);
    const RwFrame* f = image_of(current);
    std::string why;
    if (f == nullptr) {
      Rw_error("blender_render: Blender saved frame %d, which is not one of this task's", current);
      failed = true;
    } else if (!Rw_move(path, f->image, &why)) {
      Rw_error("blender_render: cannot write image \"%s\": %s", f->image.c_str(), why.c_str());
      failed = true;
    } else {
      Rw_progress(f->image, last_total, last_total);
      Rw_note("wrote %s", f->image.c_str());
      saved++;
    }
  }

  void line(const std::string& line) {
    if (line.compare(0, 4, "Fra:") == 0) {
      status_line(line);
    } else if (line.compare(0, 8, "Saved: '") == 0 && line.size() > 9) {
      saved_line(line);
    } else {
      Rw_note("%s", line.c_str());
    }
  }
};

}  // namespace

int main(int argc, char** argv) {
  RwArgs args;
  std::vector<RwFrame> frames;
  if (int status = Rw_start(argc, argv, kUsage, &args, &frames); status >= 0) return status;
  for (const RwFrame& f : frames) {
    if (args.animate && f.frame != std::floor(f.frame)) {
      Rw_error("blender_render: Blender renders whole frames only, not frame %g", f.frame);
      return 1;
    }
  }
  std::vector<std::string> cmd = blender_command(args, frames);

  Rw_note("blender_render: denoising is turned off for this render");
  Rw_note("blender_render: %zu frame%s of \"%s\"", frames.size(), frames.size() == 1 ? "" : "s",
          args.scene.c_str());

  BlenderRun run{args, frames};
  int status = Rw_run(cmd, [&](const std::string& line) { run.line(line); });
  if (status == 0 && !run.failed && run.saved == frames.size()) return 0;
  if (status != -1)
    Rw_error("blender_render: Blender ended with status %d after %zu of %zu frames", status,
             run.saved, frames.size());
  return 1;
}
