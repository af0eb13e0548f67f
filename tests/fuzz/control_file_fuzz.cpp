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

#include <vector>

#include "tests/fuzz/fuzz_support.h"
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

bool parse(const std::string& text, const char* file) {
  failed = false;
  return RJC_parse_string(text.data(), text.size(), file) == 0 && !failed;
}

// Reads both texts into empty lists and writes them again.
bool reread(std::string& devs, std::string& jobs) {
  text_records::delete_lists();
  if (!parse(devs, "Render_Resource_Control") || !parse(jobs, "Render_Job_Control")) return false;
  devs = text_records::written(Resource_control_write_dev);
  jobs = text_records::written(Job_control_write_dev);
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  [[maybe_unused]] static const bool ready = [] {
    // Blocks with index 0 ask for a fresh index, which lives in a file of the
    // control directory.
    rndctl.location.set(fuzz::scratch_dir("rjc_fuzz").c_str());
    rndctl.host.set("fuzzhost");
    rndctl.user.set("fuzzer");
    rndctl.pid = getpid();
    RJC_fatal_exit = [](int) { failed = true; };
    return true;
  }();
  const std::string input(reinterpret_cast<const char*>(data), size);

  text_records::delete_lists();
  std::vector<std::string> texts(1);
  for (char c : input) c == '\0' ? texts.emplace_back() : texts.back() += c;
  failed = false;
  const std::string failure = text_records::check(texts);
  fuzz::require(failure.empty() && !failed, failure.c_str());

  fuzz::require(parse(kResources, "Render_Resource_Control"), "the resources do not read");
  if (parse(input, "Render_Job_Control")) {
    std::string devs = text_records::written(Resource_control_write_dev);
    std::string jobs = text_records::written(Job_control_write_dev);
    fuzz::require(reread(devs, jobs), "the writer wrote what the reader refuses");
    const std::string devs_once = devs, jobs_once = jobs;
    fuzz::require(reread(devs, jobs) && devs == devs_once && jobs == jobs_once,
                  "the rewrite did not settle");
  }
  text_records::delete_lists();
  return 0;
}
