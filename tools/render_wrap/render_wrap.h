// render_wrap: what every wrapper around a real renderer shares.
//
// The daemon runs a job's render program with its own argument list
//   -p PIX [-m MATTE] -A [-s START -e END -b BY [-S FIRSTEXT -B EXTSTEP] -E EXTSIZE]
//   [-V] [-nN] ["OPTIONS"] SCENE
// with stderr going to the task's stream file, whose last line it reads as
// progress ("<image>.<extension> r <lines done + 2> of <lines>"), and stdout
// going to the task's output file, whose first line holding "Error" becomes
// the job's comment when the task fails.  A wrapper parses that list with
// Rw_parse, lists the frames and the file names the daemon expects with
// Rw_frames, runs its renderer with Rw_run (which hands it the renderer's
// output line by line, carriage-return progress included), turns those lines
// into Rw_progress and Rw_error calls, and moves each finished image into
// place with Rw_move.  A wrapper exits 0 when every frame was written and 1
// at the first frame that was not: the daemon then cuts the task at the last
// frame reported.  The queue's own test renderers (frame_painter,
// stamp_render) read the same list through Rw_scan, with their older rules
// and their own messages.
#pragma once

#include <functional>
#include <string>
#include <vector>

/// The daemon's argument list, as parsed.  Values not given keep these
/// defaults; the have_ flags say which were given.
struct RwArgs {
  std::string pix, matte, scene, options;
  bool animate = false;  // -s was given: a frame range, else one still to PIX
  float start = 1, end = 1, by = 1;
  bool have_end = false, have_by = false;
  bool have_first_ext = false;
  int first_ext = 0, ext_step = 1;
  bool have_ext_size = false;
  int ext_size = 1;
  int processors = 0;  // from -nN, 0 when not given
};

/// One frame to render and the file the daemon expects for it.
struct RwFrame {
  float frame = 0;
  int extension = 0;
  std::string image;  // PIX.<extension, zero-padded to EXTSIZE>, or PIX for a still
};

/// Where the render programs' parsers differ.  They grew up apart, and a
/// script written against one of them must keep working: the defaults are
/// the wrappers' rules, frame_painter and stamp_render turn some off.
struct RwScanRules {
  bool long_options = true;         // "--" ends the options and "--help" is -h
  bool blank_is_word = true;        // a word with a blank is never an option ("-t 2")
  bool processors_positive = true;  // -nN needs N > 0; else any digits pass
  bool by_positive = true;          // -b must be above 0
};

enum class RwScanResult {
  kOk,
  kHelp,      // -h (or --help): nothing more was read
  kUnknown,   // `word` is no option of the list
  kNoValue,   // `word` is the last argument and needs a value
  kBadValue,  // `value` does not do for option `word`
  kNoScene,   // no scene file (no argument that is not an option)
  kTooMany,   // more than the options argument and the scene
  kNoPix,     // no -p
};

struct RwScan {
  RwScanResult result = RwScanResult::kOk;
  const char* word = nullptr;   // the option at fault (argv's own text)
  const char* value = nullptr;  // its value, for kBadValue
};

/// The rules frame_painter and stamp_render were written with (stamp_render
/// never had long options).
inline RwScanRules Rw_first_rules(bool long_options) {
  return RwScanRules{.long_options = long_options,
                     .blank_is_word = false,
                     .processors_positive = false,
                     .by_positive = false};
}

/// Reads argv into *out, stopping at the first fault, and reports nothing:
/// each program says a fault in its own words.  With kOk, scene and options
/// are set and pix is not empty; the range is as given (no end is made up).
[[nodiscard]] RwScan Rw_scan(int argc, char** argv, const RwScanRules& rules, RwArgs* out);

enum class RwParse {
  kOk,     // parsed
  kHelp,   // -h/--help: the usage went to stdout; exit 0
  kUsage,  // an unknown option: named on stderr with the usage; exit 2
  kBad,    // a bad value or a missing argument: an error line went out; exit 1
};

/// The wrappers' parser: Rw_scan with the default rules, each fault reported
/// as "Error: <program>: ..." on stdout (an unknown option also on stderr,
/// with the usage), and an end before the start taken as the start.  `usage`
/// is the program's whole usage text.
[[nodiscard]] RwParse Rw_parse(int argc, char** argv, const char* usage, RwArgs* out);
/// The exit status for a parse result other than kOk.
int Rw_parse_exit(RwParse result);
/// The opening of a wrapper's main: Rw_parse with `usage`, then Rw_frames
/// into *frames.  -1 when the wrapper goes on to render, else the status it
/// is to exit with (as Rw_parse_exit gives it).
[[nodiscard]] int Rw_start(int argc, char** argv, const char* usage, RwArgs* args,
                           std::vector<RwFrame>* frames);

/// A whole decimal number (from -1e9 to 1e9) or a finite float: the whole
/// text or false.
[[nodiscard]] bool Rw_to_int(const char* text, int* out);
[[nodiscard]] bool Rw_to_float(const char* text, float* out);

/// The frame values of start..end by `by` (by > 0) as the queue counts them:
/// values below the end, plus the end when the steps land on it within a
/// thousandth of a step; the start alone when that leaves none.
std::vector<float> Rw_frame_values(float start, float end, float by);

/// The frames of the range as the queue counts them (values below the end,
/// plus the end when the steps land on it), each with its extension: FIRSTEXT
/// + i * EXTSTEP with -S, else the frame number with its fraction dropped.
std::vector<RwFrame> Rw_frames(const RwArgs& args);

/// The options argument cut at blanks.
std::vector<std::string> Rw_words(const std::string& text);

/// One "key=value" word of an options argument; key is the whole word and
/// value empty when it has no '='.
struct RwSetting {
  std::string word, key, value;
  bool has_value = false;  // the word has an '='
};
/// The options argument as settings, in order.
std::vector<RwSetting> Rw_settings(const std::string& text);

/// "<base name of image> r <done + 2> of <total>" on stderr (the reader
/// subtracts 2 from the number it reads).
void Rw_progress(const std::string& image, int done, int total);
/// "Error: <message>" on stdout, where the daemon looks for the reason of a
/// failed task.  Never on stderr: the last progress line must stay that
/// stream's last line, for the daemon cuts a failed task at its frame.
void Rw_error(const char* format, ...) __attribute__((format(printf, 1, 2)));
/// A line for the job log (stdout).
void Rw_note(const char* format, ...) __attribute__((format(printf, 1, 2)));

/// Runs argv (through PATH) with stdout and stderr into one pipe and calls
/// `line` for every line it writes, a line ending at '\n' or '\r', without
/// the ending.  Returns the exit status, 128 + the signal when it died by
/// one, or -1 when it could not be started (reported through Rw_error).
/// The renderer stays in the wrapper's process group, so that the daemon's
/// kill of the group ends it too.
[[nodiscard]] int Rw_run(const std::vector<std::string>& argv,
                         const std::function<void(const std::string&)>& line);

/// Moves a rendered image to its name, by rename or, across file systems, by
/// copy and unlink.  False (with the reason in *why) when it could not.
[[nodiscard]] bool Rw_move(const std::string& from, const std::string& to, std::string* why);

/// The renderer's program: the environment variable `env` when set and not
/// empty, else `fallback`.
std::string Rw_program(const char* env, const char* fallback);
