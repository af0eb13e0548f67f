// Feeds arbitrary bytes to the control-file reader.  Nothing may crash or
// overrun; a syntax error abandons the parse (the product would end the
// process).  What reads without error is written, read back and written
// again: the writer's output must always be readable, and after one rewrite
// (which settles unknown states to their defaults and drops the resource
// comments) the text must not change any more.
//
// The same bytes, cut at their NULs into texts, then fill every string field
// of a job, a resource and a task group: whatever they hold, the files must
// read back as the writer's forms of them and write the same again.
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Utility/rndctl/rndctl.h"
#include "tests/support/text_records.h"

namespace {

// Resources for the job files to name; read before every input.
const char kResources[] =
    "RenderResourceControl\n"
    "alpha 1 {\n\thost_name\t\t= alpha;\n\tstatus \t\t\t= SCHEDULE;\n"
    "\tlocks =\t{ 800 to 1700 Monday to Friday };\n\t}\n\n"
    "beta 2 {\n\tstatus \t\t\t= LOCKED;\n\t}\n\n"
    "End\n";

bool failed = false;

void note_failure(int) { failed = true; }

bool parse(const std::string& text, const char* file) {
  failed = false;
  int result = RJC_parse_string(text.data(), text.size(), file);
  return result == 0 && !failed;
}

// Reads both texts into empty lists and writes them again.
bool reread(std::string& devs, std::string& jobs) {
  text_records::delete_lists();
  if (!parse(devs, "Render_Resource_Control") || !parse(jobs, "Render_Job_Control")) return false;
  devs = text_records::written(Resource_control_write_dev);
  jobs = text_records::written(Job_control_write_dev);
  return true;
}

void setup() {
  // Blocks with index 0 ask for a fresh index, which lives in a file of the
  // control directory.
  static char dir[] = "/tmp/rjc_fuzz_XXXXXX";
  if (mkdtemp(dir) == nullptr) abort();
  rndctl.location.set(dir);
  rndctl.host.set("fuzzhost");
  rndctl.user.set("fuzzer");
  rndctl.pid = getpid();
  RJC_fatal_exit = note_failure;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static bool ready = (setup(), true);
  (void)ready;

  text_records::delete_lists();
  std::vector<std::string> texts(1);
  for (size_t i = 0; i < size; ++i) {
    if (data[i] == '\0')
      texts.emplace_back();
    else
      texts.back() += static_cast<char>(data[i]);
  }
  failed = false;
  std::string failure = text_records::check(texts);
  if (!failure.empty() || failed) {
    fprintf(stderr, "%s\n", failure.c_str());
    abort();
  }

  if (!parse(kResources, "Render_Resource_Control")) abort();
  if (!parse(std::string(reinterpret_cast<const char*>(data), size), "Render_Job_Control")) {
    text_records::delete_lists();
    return 0;
  }

  std::string devs = text_records::written(Resource_control_write_dev);
  std::string jobs = text_records::written(Job_control_write_dev);
  if (!reread(devs, jobs)) abort();  // the writer wrote what the reader refuses
  std::string devs_once = devs;
  std::string jobs_once = jobs;
  if (!reread(devs, jobs)) abort();
  if (devs != devs_once || jobs != jobs_once) abort();  // the rewrite did not settle
  text_records::delete_lists();
  return 0;
}
