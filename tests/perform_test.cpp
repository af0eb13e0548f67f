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

  /// Runs `program` through rj_system and waits for it; its wait status (-1: not started).
  int run(const char* program) {
    std::string prog = program;
    char* argv[] = {prog.data(), nullptr};
    int pid = rj_system(argv, path("stream").c_str(), path("out").c_str(), job_);
    return pid > 0 ? wait_for(pid) : -1;
  }

  std::string old_path_;
};

// The program run for the job's executable, with its options, frames and
// numbering: executable, step, extension (0: none; else from 100 by 10),
// output mask, animate, options, task frames, and the argv joined by '|'.
TEST(BuildArgv, ProgramOptionsFramesAndNumbering) {
  using Row = std::tuple<const char*, float, int, int, int, const char*, float, float, const char*>;
  // clang-format off
  for (auto [executable, by, extension, output_mask, animate, rnd_opts, start, end, argv] : {
           Row{"edgepass", 1, 0, 0, 1, nullptr, 1, 3, "shadepass|-V|-p|P|-A|-s|1.000000|-e|3.000000|-b|1.000000|-E|4|S"},
           Row{"glintcast", 1, 0, 0, 1, nullptr, 4, 4, "glintcast|-n4|-p|P|-A|-s|4.000000|-e|4.000000|-b|1.000000|-E|4|S"},
           Row{"glintwalk", 1, 0, 0, 0, nullptr, 1, 1, "glintwalk|-n4|-p|P|-A|S"},
           Row{"myrender", 1, 0, 1, 0, "-q  high", 1, 1, "myrender|-p|P|-m|M|-A|-q  high|S"},  // one argument
           Row{"myrender", 1, 0, 0, 0, "   ", 1, 1, "myrender|-p|P|-A|S"},  // blanks only are dropped
           Row{"myrender", 0.5f, 0, 0, 1, nullptr, 2, 3, "myrender|-p|P|-A|-s|2.000000|-e|3.000000|-b|0.500000|-S|3|-B|1|-E|4|S"},
           Row{"myrender", 1, 1, 0, 1, nullptr, 4, 6, "myrender|-p|P|-A|-s|4.000000|-e|6.000000|-b|1.000000|-S|130|-B|10|-E|4|S"}}) {
    // clang-format on
    Job job;
    job.executable.set(executable), job.rnd_opts.set(rnd_opts);
    job.pix.set("P"), job.matte.set("M"), job.sdl.set("S");
    // The extension numbers count only when the flag word is set.
    std::tie(job.frames[0], job.frames[2], job.output_mask, job.animate, job.extension) =
        std::tuple(1.f, by, output_mask, animate, extension != 0 ? 291 : 0);
    std::tie(job.ext_start, job.ext_by, job.ext_size) = std::tuple(100, 10, 4);
    std::string joined;
    for (const std::string& a : Task_build_argv(&job, 4, start, end)) joined += "|" + a;
    EXPECT_EQ(joined.substr(1), argv);
  }
}

TEST_F(PerformTest, RenderProgramRunsInProjectDirWithItsOwnStreamsGroupSignalsAndOutput) {
  for (const char* dir : {"/maps/a", "/maps/b"}) RndPathList_add(job_, dir);
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

  EXPECT_EQ(std::tuple(rndctl.running, std::filesystem::current_path().string(), dev_->last_task),
            std::tuple(running_before + 1, cwd_before, entry));
  EXPECT_STREQ(entry->out_path.c_str(), path("pix/out.img.testhost.render1.0").c_str());
  const std::string pid = std::to_string(entry->pid);
  EXPECT_THAT(out,
              testing::EndsWith("cwd=" + std::filesystem::canonical(path("proj")).string() +
                                "\nsearch=[ /maps/a /maps/b]\npid=" + pid + " pgid=" + pid + "\n"));
  // The standard signals only: 32 and 33 belong to the C library, which
  // lets no program change them, so a test runner may hand them down ignored.
  EXPECT_EQ((signal_mask(out, "SigBlk:") | signal_mask(out, "SigIgn:")) & 0x7fffffffULL, 0ULL)
      << out;
  EXPECT_EQ(read_file("stream"), "pix.0001 r 5 of 10\n");
  EXPECT_EQ(getenv("ZARNO_PIX_SEARCHPATH"), nullptr);  // only the child's environment has it

  // A pix path without a directory puts the output beside the program, in the
  // project directory, where the daemon finds it too; the counter wraps.
  job_->pix.set("img");
  job_->animate = 0;
  rndctl.out_counter = INT_MAX;
  out = perform(add_entry(job_, dev_, 2, 2, TASK_STARTED));
  EXPECT_EQ(std::pair(read_file("proj/out.img.testhost.render1.2147483647"), rndctl.out_counter),
            std::pair(out, 0));
}

// The program is found on PATH (as bin/PROGRAM with its text and mode, unless
// none) or the child reports why in the stdout file and the stream.
TEST_F(PerformTest, ProgramIsFoundOnPathOrTheChildReportsWhy) {
  // clang-format off
  for (auto [program, text, mode, exit_code, out] : {
           std::tuple<const char*, const char*, int, int, const char*>{"no_such_render_program", nullptr, 0, 255, "system(\"no_such_render_program\") failed at exec <No such file or directory>\n"},
           {"readonly", "echo ran\n", 0644, 255, "system(\"readonly\") failed at exec <Permission denied>\n"},
           {"plain", "echo ran \"$1\"\n", 0755, 0, "ran \n"}}) {  // no interpreter line
    // clang-format on
    if (text != nullptr) write_file(std::string("bin/") + program, text);
    if (text != nullptr) chmod(path(std::string("bin/") + program).c_str(), mode);
    int status = run(program);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == exit_code) << program << " " << status;
    EXPECT_EQ(read_file("out") + "|" + read_file("stream"),
              std::string(out) + "|" + (exit_code == 255 ? out : ""))
        << program;
  }
  // A planted link does not redirect the stream.
  write_file("victim", "untouched");
  unlink(path("stream").c_str());
  ASSERT_EQ(symlink(path("victim").c_str(), path("stream").c_str()), 0);
  run("myrender");
  EXPECT_EQ(read_file("victim"), "untouched");
}

}  // namespace
