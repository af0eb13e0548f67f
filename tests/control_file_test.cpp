// The control-file reader and writers: hand-written files with their exact
// rewritten form, records holding any text written, read back and written
// again, and the ways a bad file ends the process.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cfloat>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "tests/support/test_support.h"
#include "tests/support/text_records.h"

namespace {

using testing::AllOf;
using testing::AnyOf;
using testing::HasSubstr;
using testing::Not;

using text_records::delete_lists;
using text_records::written;

std::string written_jobs() { return written(Job_control_write_dev); }
std::string written_devs() { return written(Resource_control_write_dev); }

int parse(const std::string& text, const char* file = "Render_Job_Control") {
  return RJC_parse_string(text.data(), text.size(), file);
}
int parse_devs(const std::string& text) { return parse(text, "Render_Resource_Control"); }

int fatal_status = 0;  // what the last syntax or lexical error ended with

class ControlFileTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    setenv("DRCTMPDIR", "/golden/tmp", 1);
    // The death tests wait for their child and expect it to die of abort,
    // whatever an earlier test in the same process did to these signals.
    sigset_t both;
    sigemptyset(&both);
    for (int sig : {SIGCHLD, SIGABRT}) signal(sig, SIG_DFL), sigaddset(&both, sig);
    sigprocmask(SIG_UNBLOCK, &both, nullptr);
  }
  void TearDown() override {
    RJC_fatal_exit = nullptr;
    ControlDirTest::TearDown();
  }
  /// Errors end the parse instead of the process, and are counted.
  static void survive_errors() {
    fatal_status = 0;
    RJC_fatal_exit = [](int s) { fatal_status = s; };
  }
};

// Hand-written files: each case reads a resource file and a job file and
// must write back exactly the expected text, which in turn is a fixed point.
class GoldenTest : public ControlFileTest, public testing::WithParamInterface<const char*> {};

TEST_P(GoldenTest, RewritesExactly) {
  const std::string dir = std::string(TESTS_DIR) + "/golden/" + GetParam() + "/Render_";
  const std::string res_in = read_text_file(dir + "Resource_Control.in"),
                    job_in = read_text_file(dir + "Job_Control.in"),
                    res_out = read_text_file(dir + "Resource_Control.out"),
                    job_out = read_text_file(dir + "Job_Control.out");
  ASSERT_FALSE(res_in.empty() || job_in.empty() || res_out.empty() || job_out.empty());

  ASSERT_EQ(parse_devs(res_in), 0);
  ASSERT_EQ(parse(job_in), 0);
  EXPECT_EQ(written_devs(), res_out);
  EXPECT_EQ(written_jobs(), job_out);

  // What was written reads back as itself, except where a state was written
  // as nothing (an unknown lock state comes back as the default).
  delete_lists();
  ASSERT_EQ(parse_devs(res_out), 0);
  ASSERT_EQ(parse(job_out), 0);
  if (res_out.find("new_resource_7") == std::string::npos) {
    EXPECT_EQ(written_devs(), res_out);
  }
  EXPECT_EQ(written_jobs(), job_out);
}

INSTANTIATE_TEST_SUITE_P(Files, GoldenTest, testing::Values("plain", "lenient"));

TEST_F(ControlFileTest, WriterDropsDeletedJobsAndNamelessResources) {
  Dev* named = Add_a_dev(nullptr, "alpha", 1);
  ASSERT_NE(Add_a_dev(nullptr, nullptr, 2), nullptr);
  Job* first = Add_a_job(nullptr, "first.sdl", 11);
  Job* gone = Add_a_job(nullptr, "gone.sdl", 12);
  Job* last = Add_a_job(nullptr, "last.sdl", 13);
  ASSERT_TRUE(named && first && gone && last);
  RndDevList_add(gone, named);
  gone->deleted = last->deleted = 1;

  EXPECT_THAT(written_devs(), AllOf(HasSubstr("alpha 1 {\n"), Not(HasSubstr(" 2 {\n"))));
  EXPECT_THAT(written_jobs(), AllOf(HasSubstr("first.sdl 11 {\n"),
                                    Not(AnyOf(HasSubstr("gone.sdl"), HasSubstr("last.sdl")))));
  // Gone from memory too, and from the resource's list of jobs.
  EXPECT_EQ(std::tuple(rndctl.jobs, first->next, Job_by_index(12), named->jobs),
            std::tuple(first, nullptr, nullptr, nullptr));
}

TEST_F(ControlFileTest, StringsAreCutAt1023Characters) {
  // The cut leaves "; priority = 5;" to be read as statements.  With any other
  // limit the line does not parse.
  survive_errors();
  ASSERT_EQ(parse("RenderJobControl 1 1\ncut.sdl 4 {\n\tstatus = \"" + std::string(1023, 'A') +
                  "; priority = 5; status = \"x\";\n}\n"),
            0);
  ASSERT_NE(Job_by_index(4), nullptr);
  EXPECT_EQ(
      std::tuple(fatal_status, Job_by_index(4)->priority, Job_by_index(4)->status.or_else("")),
      std::tuple(0, 5, std::string("x")));

  // A string of exactly the limit keeps its closing quote.
  delete_lists();
  const std::string full(1023, 'B');
  ASSERT_EQ(parse("RenderJobControl 1 1\nfull.sdl 4 {\n\tstatus = \"" + full + "\";\n}\n"), 0);
  ASSERT_NE(Job_by_index(4), nullptr);
  EXPECT_EQ(Job_by_index(4)->status.c_str(), full);
}

// Reals are read exactly as the C library reads them, then narrowed; huge
// ones stop at the largest float so that the writer never prints "inf".
class RealTextTest : public ControlFileTest, public testing::WithParamInterface<const char*> {};

TEST_P(RealTextTest, ReadsAsStrtod) {
  const std::string real = GetParam();
  ASSERT_EQ(parse("RenderJobControl 1 1\nr.sdl 4 {\n\tframes = " + real + ", 1, 1;\n}\n"), 0);
  ASSERT_NE(Job_by_index(4), nullptr);
  double expected = strtod(real.c_str(), nullptr);
  EXPECT_EQ(Job_by_index(4)->frames[0],
            static_cast<float>(expected > FLT_MAX ? FLT_MAX : expected));
}

INSTANTIATE_TEST_SUITE_P(Texts, RealTextTest,
                         testing::Values("0.1", "16777217.0", "0.30000000000000004", "-0.0", "-.5",
                                         "1.2.3", "1-2.5", "-.",
                                         "99999999999999999999999999999999999999999.0"));

TEST_F(ControlFileTest, ReaderStartsAfreshOnEachStream) {
  survive_errors();
  // Abandoned inside a job block, in the middle of a string.
  EXPECT_NE(parse("RenderJobControl 1 1\nhalf.sdl 3 {\n\tpriority = 2;\n\tsdl = \"/x"), 0);
  ASSERT_NE(Job_by_index(3), nullptr);
  EXPECT_EQ(std::pair(fatal_status, Job_by_index(3)->priority), std::pair(-1, 2));

  fatal_status = 0;
  ASSERT_EQ(parse_devs("RenderResourceControl\nbox 9 { max_frames = 6; }\nEnd\n"), 0);
  ASSERT_NE(Dev_by_index(9), nullptr);
  EXPECT_EQ(std::pair(fatal_status, Dev_by_index(9)->max_frames), std::pair(0, 6));
}

TEST_F(ControlFileTest, NullStreamReadsNothingNotStandardInput) {
  // Were the reader to fall back on stdin, it would find this job there.
  write_file("stdin.txt", "RenderJobControl 1 1\nstdin.sdl 5 {\n}\n");
  ASSERT_NE(freopen(path("stdin.txt").c_str(), "r", stdin), nullptr);
  RJCin = nullptr;
  EXPECT_EQ(RJCparse(), 0);
  EXPECT_EQ(rndctl.jobs, nullptr);
}

// A file the grammar cannot read ends the process with three messages; with
// the process kept alive, the parse is abandoned.
struct BadFile {
  const char *label, *file, *text;
  int line;
};

class SyntaxErrorTest : public ControlFileTest, public testing::WithParamInterface<BadFile> {};

TEST_P(SyntaxErrorTest, AbortsNamingLineAndFile) {
  const BadFile& bad = GetParam();
  const std::string text = bad.text, said = "Syntax error: line " + std::to_string(bad.line) +
                                            " of " + bad.file + " file\n";
  EXPECT_EXIT((debug = 1, dup2(STDERR_FILENO, STDOUT_FILENO), parse(text, bad.file)),
              testing::KilledBySignal(SIGABRT), said + "\\*\\*\\*\\*\\*\\*\\*\\* " + said);

  survive_errors();
  EXPECT_NE(parse(bad.text, bad.file), 0);
  EXPECT_EQ(fatal_status, -1);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Files, SyntaxErrorTest, testing::Values(
    BadFile{"MissingSemicolon", "Render_Job_Control", "RenderJobControl 1 1\na.sdl 3 {\n\tpriority = 4\n}\n", 4},
    BadFile{"CutInsideBlock", "Render_Job_Control", "RenderJobControl 1 1\na.sdl 3 {\n\tpriority = 4;\n", 4},
    BadFile{"UnknownKeyword", "Render_Job_Control", "RenderJobControl 1 1\na.sdl 3 {\n\tusers = bob;\n}\n", 3},
    BadFile{"ResourceKeywordInJob", "Render_Job_Control", "RenderJobControl 1 1\n\na.sdl 3 {\n\tlocks = { 800 to 900 Monday };\n}\n", 4},
    BadFile{"JobKeywordInResource", "Render_Resource_Control", "RenderResourceControl\nh 1 {\n\truns = { 800 to 900 Monday };\n\t}\n", 3},
    BadFile{"StringRunsToEnd", "Render_Job_Control", "RenderJobControl 1 1\na.sdl 3 {\n\tstatus = \"abc\n\ndef", 5},
    BadFile{"LinesCountFromHeader", "Render_Job_Control", "\n\n\nRenderJobControl 1 1\nfoo;\n", 2},
    BadFile{"TextAfterEnd", "Render_Resource_Control", "RenderResourceControl\nEnd\nh 1 { status = LOCKED; }\n", 3}),
    by_label);
// clang-format on

TEST_F(ControlFileTest, LexicalErrorExitsWithMinusOne) {
  std::tie(RJCreadfile, RJCcurrent_lineno) = std::pair("Render_Job_Control", 7);
  EXPECT_EXIT((dup2(STDERR_FILENO, STDOUT_FILENO), RJClexerror("@")), testing::ExitedWithCode(255),
              "LEX: UNKNOWN TOKEN in line 7 of \"Render_Job_Control\" file \\(@\\)");
  RJCreadfile = nullptr;
}

// The check interval: what the loop cannot wait for is refused, reported
// once, and the interval in force stays.
TEST_F(ControlFileTest, BadCheckIntervalsAreRefusedOnce) {
  ASSERT_EQ(parse("RenderJobControl 3 7\nEnd\n"), 0);
  const std::pair<const char*, bool> cases[] = {
      {"-1 0", true},       {"0 -1", true}, {"1 60", true},       {"2147483647 0", true},
      {"35791394 8", true}, {"0 0", false}, {"35791394 7", false}};
  for (auto [header, refused] : cases) {
    SCOPED_TRACE(header);
    const unsigned min = rndctl.interval_min, sec = rndctl.interval_sec;
    const std::string head = std::string("RenderJobControl ") + header + "\n";
    testing::internal::CaptureStderr();
    ASSERT_EQ(parse(head + "End\n"), 0);
    ASSERT_EQ(parse(head + "End\n"), 0);  // a reload of the same file
    const std::string log = testing::internal::GetCapturedStderr();
    if (refused) {
      EXPECT_EQ(std::pair(rndctl.interval_min, rndctl.interval_sec), std::pair(min, sec));
      char expected[256];
      snprintf(expected, sizeof expected,
               " from Render_Job_Control: out of range, keeping %u:%02u\n", min, sec);
      EXPECT_THAT(log, HasSubstr(expected));
      EXPECT_EQ(log.find("ignoring check interval"), log.rfind("ignoring check interval"));
    } else {
      EXPECT_THAT(log, Not(HasSubstr("ignoring")));
      EXPECT_THAT(written_jobs(), HasSubstr(head));
    }
  }
  testing::internal::CaptureStderr();
  EXPECT_EQ(RJC_set_check_interval(-1, 59, "-u"), 0);
  EXPECT_THAT(
      testing::internal::GetCapturedStderr(),
      HasSubstr("ignoring check interval -1:59 from -u: out of range, keeping 35791394:07"));
}

// A render program's output goes into the job's comment: whatever it holds,
// the job file still parses and keeps the line's readable text.
class ErrorLineTest : public ControlFileTest, public testing::WithParamInterface<std::string> {};

TEST_P(ErrorLineTest, CommentReadsBack) {
  Job* job = Add_a_job(nullptr, "e.sdl", 5);
  Dev* dev = host_dev("box", 1, "boxhost");
  ASSERT_TRUE(job && dev);
  job->comment.set("earlier */ note");
  write_file("out.log", GetParam());
  TaskRec rec;
  std::tie(rec.dev, rec.start) = std::tuple(dev, 12.0f);
  TASK entry;  // owns no record: the one above is on the stack
  std::tie(entry.rec, entry.job, entry.waitstatus) = std::tuple(&rec, job, 1);
  entry.out_path.set(path("out.log").c_str());
  Job_Error_Update(&entry);
  entry.rec = nullptr;
  EXPECT_THAT(job->comment.or_else(""), HasSubstr("ERROR: box (boxhost) frame 12.0\n"));

  const std::string jobs = written_jobs();
  delete_lists();
  survive_errors();
  ASSERT_EQ(parse(jobs), 0) << jobs;
  ASSERT_NE(Job_by_index(5), nullptr);
  EXPECT_THAT(
      Job_by_index(5)->comment.or_else(""),
      AllOf(HasSubstr("earlier * / note"), HasSubstr("Error"), HasSubstr("frame 12 failed")));
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Outputs, ErrorLineTest, testing::Values(
    std::string("rendering\nError: frame 12 failed */ now\n"),
    std::string("Error \"quoted\" frame 12 failed \"\n"),
    std::string("\x1b[31mError\x1b[0m frame 12 failed\a\r\n"),
    std::string("junk\x01\x02\xff") + std::string(1, '\0') + "Error frame 12 failed\0tail\n",
    "Error frame 12 failed " + std::string(280, 'x') + "\n",
    std::string(300, '*') + "/Error frame 12 failed\n"));
// clang-format on

}  // namespace
