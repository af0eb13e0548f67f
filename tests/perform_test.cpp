// Starting render programs: real children, real files.  The "render
// programs" are small shell scripts on PATH that report what they were given.
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "tests/support/task_fixture.h"

namespace {

// Only shell builtins read /proc: a forking shell blocks every signal for a
// moment, and an outside reader could catch it in that window.
constexpr const char* kReporter =
    "#!/bin/sh\n"
    "while read -r key value; do\n"
    "  case \"$key\" in SigBlk:|SigIgn:) echo \"$key $value\";; esac\n"
    "done < /proc/$$/status\n"
    "echo \"cwd=$(pwd -P)\"\n"
    "echo \"search=[$ZARNO_PIX_SEARCHPATH]\"\n"
    "read -r stat < /proc/$$/stat; set -- $stat; echo \"pid=$$ pgid=$5\"\n"
    "echo 'pix.0001 r 5 of 10' >&2\n";

// The hexadecimal mask after `key` in a /proc status text; all ones when absent.
unsigned long long signal_mask(const std::string& text, const char* key) {
  size_t at = text.find(key);
  return at == std::string::npos ? ~0ULL : strtoull(text.c_str() + at + strlen(key), nullptr, 16);
}

class PerformTest : public TaskFixture {
 protected:
  void SetUp() override {
    TaskFixture::SetUp();
    mkdir_p("bin");
    write_file("bin/myrender", kReporter);
    chmod(path("bin/myrender").c_str(), 0755);
    old_path_ = getenv("PATH") != nullptr ? getenv("PATH") : "";
    setenv("PATH", (path("bin") + ":" + old_path_).c_str(), 1);
  }
  void TearDown() override {
    setenv("PATH", old_path_.c_str(), 1);
    TaskFixture::TearDown();
  }

  /// Starts the entry's render program, waits for it and returns its stdout.
  std::string perform(TASK* entry) {
    entry->stream_path.set(path("stream").c_str());
    EXPECT_EQ(Perform_a_Task(entry), 1);
    EXPECT_GE(entry->pid, 2);
    int status = wait_for(entry->pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    return read_text_file(entry->out_path.c_str());
  }

  std::string old_path_;
};

struct ArgCase {
  const char *label, *executable;
  float by;
  int extension, output_mask, animate;  // extension 0: none; else from 100 by 10
  const char* rnd_opts;
  float start, end;
  const char* argv;  // joined by '|'
};

class BuildArgv : public testing::TestWithParam<ArgCase> {};

TEST_P(BuildArgv, ProgramOptionsFramesAndNumbering) {
  const ArgCase& c = GetParam();
  Job job;
  job.executable.set(c.executable);
  job.pix.set("P");
  job.matte.set("M");
  job.sdl.set("S");
  job.rnd_opts.set(c.rnd_opts);
  job.frames[0] = 1;
  job.frames[2] = c.by;
  job.output_mask = c.output_mask;
  job.animate = c.animate;
  job.extension = c.extension != 0 ? 291 : 0;  // the numbers below count only when set
  std::tie(job.ext_start, job.ext_by, job.ext_size) = std::tuple(100, 10, 4);
  std::string joined;
  for (const std::string& a : Task_build_argv(&job, 4, c.start, c.end)) joined += "|" + a;
  EXPECT_EQ(joined.substr(1), c.argv);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Programs, BuildArgv, testing::Values(
    ArgCase{"edgepass_runs_shadepass_verbose", "edgepass", 1, 0, 0, 1, nullptr, 1, 3, "shadepass|-V|-p|P|-A|-s|1.000000|-e|3.000000|-b|1.000000|-E|4|S"},
    ArgCase{"glintcast_gets_processors", "glintcast", 1, 0, 0, 1, nullptr, 4, 4, "glintcast|-n4|-p|P|-A|-s|4.000000|-e|4.000000|-b|1.000000|-E|4|S"},
    ArgCase{"glintwalk_gets_processors", "glintwalk", 1, 0, 0, 0, nullptr, 1, 1, "glintwalk|-n4|-p|P|-A|S"},
    ArgCase{"mask_and_options_as_one_argument", "myrender", 1, 0, 1, 0, "-q  high", 1, 1, "myrender|-p|P|-m|M|-A|-q  high|S"},
    ArgCase{"options_of_blanks_only_are_dropped", "myrender", 1, 0, 0, 0, "   ", 1, 1, "myrender|-p|P|-A|S"},
    ArgCase{"half_step_numbers_the_frames", "myrender", 0.5f, 0, 0, 1, nullptr, 2, 3, "myrender|-p|P|-A|-s|2.000000|-e|3.000000|-b|0.500000|-S|3|-B|1|-E|4|S"},
    ArgCase{"job_extension_numbers", "myrender", 1, 1, 0, 1, nullptr, 4, 6, "myrender|-p|P|-A|-s|4.000000|-e|6.000000|-b|1.000000|-S|130|-B|10|-E|4|S"}),
    [](const testing::TestParamInfo<ArgCase>& info) { return std::string(info.param.label); });
// clang-format on

TEST_F(PerformTest, RenderProgramRunsInProjectDirWithItsOwnStreamsGroupAndSignals) {
  RndPathList_add(job_, "/maps/a");
  RndPathList_add(job_, "/maps/b");
  TASK* entry = add_entry(job_, dev_, 1, 1, TASK_STARTED);

  // The daemon keeps these blocked and may ignore others: none of it may
  // reach the render program.
  sigset_t block, saved;
  sigfillset(&block);
  sigprocmask(SIG_BLOCK, &block, &saved);
  void (*saved_hup)(int) = signal(SIGHUP, SIG_IGN);
  std::string cwd_before = std::filesystem::current_path().string();
  int running_before = rndctl.running;
  std::string out = perform(entry);
  sigprocmask(SIG_SETMASK, &saved, nullptr);
  signal(SIGHUP, saved_hup);

  EXPECT_EQ(rndctl.running, running_before + 1);
  EXPECT_EQ(std::filesystem::current_path().string(), cwd_before);
  EXPECT_EQ(dev_->last_task, entry);
  EXPECT_STREQ(entry->out_path.c_str(), path("pix/out.img.testhost.render1.0").c_str());
  const std::string pid = std::to_string(entry->pid);
  EXPECT_THAT(out,
              testing::EndsWith("cwd=" + std::filesystem::canonical(path("proj")).string() +
                                "\nsearch=[ /maps/a /maps/b]\npid=" + pid + " pgid=" + pid + "\n"));
  // The standard signals only: 32 and 33 belong to the C library, which
  // lets no program change them, so a test runner may hand them down ignored.
  EXPECT_EQ(signal_mask(out, "SigBlk:") & 0x7fffffffULL, 0ULL) << out;
  EXPECT_EQ(signal_mask(out, "SigIgn:") & 0x7fffffffULL, 0ULL) << out;
  EXPECT_EQ(read_file("stream"), "pix.0001 r 5 of 10\n");
  // Only the child's environment has it.
  EXPECT_EQ(getenv("ZARNO_PIX_SEARCHPATH"), nullptr);
}

TEST_F(PerformTest, PixWithoutDirectoryWritesOutputBesideTheProgramAndCountsUp) {
  job_->pix.set("img");
  job_->animate = 0;
  rndctl.out_counter = INT_MAX;
  std::string out = perform(add_entry(job_, dev_, 1, 1, TASK_STARTED));
  // Beside the program, in the project directory, where the daemon finds it too.
  EXPECT_EQ(read_file("proj/out.img.testhost.render1.2147483647"), out);
  EXPECT_EQ(rndctl.out_counter, 0);
}

struct ExecCase {
  const char *label, *program, *text;  // on PATH as bin/PROGRAM with `text` and `mode` unless null
  int mode, exit_code;
  const char* out;  // the stdout file; also the stream when the exec failed
};

class ExecOutcome : public PerformTest, public testing::WithParamInterface<ExecCase> {};

TEST_P(ExecOutcome, ProgramIsFoundOnPathOrTheChildReportsWhy) {
  const ExecCase& c = GetParam();
  if (c.text != nullptr) {
    write_file(std::string("bin/") + c.program, c.text);
    chmod(path(std::string("bin/") + c.program).c_str(), static_cast<mode_t>(c.mode));
  }
  std::string prog = c.program;
  char* argv[] = {prog.data(), nullptr};
  int pid = rj_system(argv, path("stream").c_str(), path("out").c_str(), job_);
  ASSERT_GT(pid, 0);
  int status = wait_for(pid);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == c.exit_code) << status;
  EXPECT_EQ(read_file("out"), c.out);
  EXPECT_EQ(read_file("stream"), c.exit_code == 255 ? c.out : "");
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Programs, ExecOutcome, testing::Values(
    ExecCase{"missing", "no_such_render_program", nullptr, 0, 255, "system(\"no_such_render_program\") failed at exec <No such file or directory>\n"},
    ExecCase{"not_executable", "readonly", "echo ran\n", 0644, 255, "system(\"readonly\") failed at exec <Permission denied>\n"},
    ExecCase{"script_without_interpreter_line", "plain", "echo ran \"$1\"\n", 0755, 0, "ran \n"}),
    [](const testing::TestParamInfo<ExecCase>& info) { return std::string(info.param.label); });
// clang-format on

TEST_F(PerformTest, PlantedLinkDoesNotRedirectTheStream) {
  write_file("victim", "untouched");
  ASSERT_EQ(symlink(path("victim").c_str(), path("stream").c_str()), 0);
  char prog[] = "myrender";
  char* argv[] = {prog, nullptr};
  int pid = rj_system(argv, path("stream").c_str(), path("out").c_str(), job_);
  ASSERT_GT(pid, 0);
  wait_for(pid);
  EXPECT_EQ(read_file("victim"), "untouched");
}

}  // namespace
