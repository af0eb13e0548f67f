// The control-file reader and writers: hand-written files with their exact
// rewritten form, random record sets written, read back and written again,
// and the ways a bad file ends the process.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cfloat>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "tests/support/test_support.h"

namespace {

using testing::HasSubstr;
using testing::Not;

std::string written(void (*writer)(FILE*)) {
  char* buf = nullptr;
  size_t size = 0;
  FILE* fp = open_memstream(&buf, &size);
  if (fp == nullptr) return "<open_memstream failed>";
  writer(fp);
  fclose(fp);
  std::string text(buf, size);
  free(buf);
  return text;
}

std::string written_jobs() { return written(Job_control_write_dev); }
std::string written_devs() { return written(Resource_control_write_dev); }

int parse(const std::string& text, const char* file = "Render_Job_Control") {
  return RJC_parse_string(text.data(), text.size(), file);
}
int parse_devs(const std::string& text) { return parse(text, "Render_Resource_Control"); }

void delete_lists() {
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
}

// Everything a reload replaces, so that a file can be read into empty lists
// while the records it was written from are kept for comparison.
void swap_lists(RndCtl& a, RndCtl& b) {
  std::swap(a.jobs, b.jobs);
  std::swap(a.devs, b.devs);
  std::swap(a.job_index, b.job_index);
  std::swap(a.dev_index, b.dev_index);
  std::swap(a.dev_name_index, b.dev_name_index);
}

int fatal_status = 0;  // what the last syntax or lexical error ended with

class ControlFileTest : public ControlDirTest {
 protected:
  void SetUp() override {
    ControlDirTest::SetUp();
    setenv("DRCTMPDIR", "/golden/tmp", 1);
    // The death tests wait for their child and expect it to die of abort,
    // whatever an earlier test in the same process did to these signals.
    signal(SIGCHLD, SIG_DFL);
    signal(SIGABRT, SIG_DFL);
    sigset_t both;
    sigemptyset(&both);
    sigaddset(&both, SIGCHLD);
    sigaddset(&both, SIGABRT);
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
  const std::string dir = std::string(TESTS_DIR) + "/golden/" + GetParam() + "/";
  const std::string res_in = read_text_file(dir + "Render_Resource_Control.in");
  const std::string job_in = read_text_file(dir + "Render_Job_Control.in");
  const std::string res_out = read_text_file(dir + "Render_Resource_Control.out");
  const std::string job_out = read_text_file(dir + "Render_Job_Control.out");
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

  const std::string devs = written_devs();
  EXPECT_THAT(devs, HasSubstr("alpha 1 {\n"));
  EXPECT_THAT(devs, Not(HasSubstr(" 2 {\n")));
  const std::string jobs = written_jobs();
  EXPECT_THAT(jobs, HasSubstr("first.sdl 11 {\n"));
  EXPECT_THAT(jobs, Not(HasSubstr("gone.sdl")));
  EXPECT_THAT(jobs, Not(HasSubstr("last.sdl")));
  // Gone from memory too, and from the resource's list of jobs.
  EXPECT_EQ(rndctl.jobs, first);
  EXPECT_EQ(first->next, nullptr);
  EXPECT_EQ(Job_by_index(12), nullptr);
  EXPECT_EQ(named->jobs, nullptr);
}

TEST_F(ControlFileTest, StringsAreCutAt1023Characters) {
  // The cut leaves "; priority = 5;" to be read as statements.  With any other
  // limit the line does not parse.
  survive_errors();
  ASSERT_EQ(parse("RenderJobControl 1 1\ncut.sdl 4 {\n\tstatus = \"" + std::string(1023, 'A') +
                  "; priority = 5; status = \"x\";\n}\n"),
            0);
  EXPECT_EQ(fatal_status, 0);
  ASSERT_NE(Job_by_index(4), nullptr);
  EXPECT_EQ(Job_by_index(4)->priority, 5);
  EXPECT_STREQ(Job_by_index(4)->status.c_str(), "x");

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
                         testing::Values("0.1", "-2.500000", "3.14159265358979", "16777217.0",
                                         "123456789.123456", "0.30000000000000004", "-0.0", "-.5",
                                         "1.2.3", "1-2.5", "-.",
                                         "99999999999999999999999999999999999999999.0"));

// Frames are written as "%f" of the float widened to double, whatever the
// value.
class FramesTextTest : public ControlFileTest, public testing::WithParamInterface<float> {};

TEST_P(FramesTextTest, PrintAsPercentF) {
  Job* job = Add_a_job(nullptr, "f.sdl", 4);
  ASSERT_NE(job, nullptr);
  job->animate = 1;
  const double f = GetParam();
  job->frames[0] = GetParam();
  job->frames[1] = 2.0f;
  job->frames[2] = -GetParam();
  char expected[512];
  snprintf(expected, sizeof expected, "\tframes\t\t= %f, %f, %f;\n", f, 2.0, -f);
  EXPECT_THAT(written_jobs(), HasSubstr(expected));
}

INSTANTIATE_TEST_SUITE_P(Values, FramesTextTest,
                         testing::Values(0.0f, 250.0f, 0.5f, 1e9f, 999999999.0f, 16777216.0f,
                                         2147483648.0f, 3.4e38f, 1e-7f, 0.1f));

TEST_F(ControlFileTest, ReaderStartsAfreshOnEachStream) {
  survive_errors();
  // Abandoned inside a job block, in the middle of a string.
  EXPECT_NE(parse("RenderJobControl 1 1\nhalf.sdl 3 {\n\tpriority = 2;\n\tsdl = \"/x"), 0);
  EXPECT_EQ(fatal_status, -1);
  ASSERT_NE(Job_by_index(3), nullptr);
  EXPECT_EQ(Job_by_index(3)->priority, 2);

  fatal_status = 0;
  ASSERT_EQ(parse_devs("RenderResourceControl\nbox 9 { max_frames = 6; }\nEnd\n"), 0);
  ASSERT_NE(Dev_by_index(9), nullptr);
  EXPECT_EQ(Dev_by_index(9)->max_frames, 6);
  EXPECT_EQ(fatal_status, 0);
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
  const char* name;
  const char* file;
  const char* text;
  int line;
};

class SyntaxErrorTest : public ControlFileTest, public testing::WithParamInterface<BadFile> {};

TEST_P(SyntaxErrorTest, AbortsNamingLineAndFile) {
  const BadFile& bad = GetParam();
  char expected[256];
  snprintf(expected, sizeof expected,
           "Syntax error: line %d of %s file\n\\*\\*\\*\\*\\*\\*\\*\\* Syntax error: line %d of "
           "%s file\n",
           bad.line, bad.file, bad.line, bad.file);
  const std::string text = bad.text;
  EXPECT_EXIT(
      {
        debug = 1;
        dup2(STDERR_FILENO, STDOUT_FILENO);
        parse(text, bad.file);
      },
      testing::KilledBySignal(SIGABRT), expected);

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
    [](const testing::TestParamInfo<BadFile>& info) { return std::string(info.param.name); });
// clang-format on

TEST_F(ControlFileTest, LexicalErrorExitsWithMinusOne) {
  RJCreadfile = "Render_Job_Control";
  RJCcurrent_lineno = 7;
  EXPECT_EXIT(
      {
        dup2(STDERR_FILENO, STDOUT_FILENO);
        RJClexerror("@");
      },
      testing::ExitedWithCode(255),
      "LEX: UNKNOWN TOKEN in line 7 of \"Render_Job_Control\" file \\(@\\)");
  RJCreadfile = nullptr;
}

// Round trip: random records written, read back into empty lists and written
// again give the same text and the same records, but for what the format
// drops on purpose.
class RoundTripTest : public ControlFileTest, public testing::WithParamInterface<unsigned> {
 protected:
  std::mt19937 rng{GetParam()};

  int pick(int lo, int hi) { return std::uniform_int_distribution<int>(lo, hi)(rng); }
  bool chance(int percent) { return pick(1, 100) <= percent; }

  // A bare word that is no keyword and no number: it starts with a letter
  // and ends with a digit, which no keyword does.
  std::string word() {
    static const char tail[] =
        "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789._#@-";
    std::string w(1, static_cast<char>(pick(0, 1) ? pick('a', 'z') : pick('A', 'Z')));
    for (int n = pick(0, 10); n > 0; --n) w += tail[pick(0, sizeof tail - 2)];
    return w + static_cast<char>(pick('0', '9'));
  }
  const char* word_or_none() { return chance(70) ? (word_ = word()).c_str() : nullptr; }

  // Free text: anything printable but a quote (a comment may hold quotes but
  // never closes itself), with blanks, tabs, newlines, and now and then right
  // at the length limit.
  std::string text(bool comment = false) {
    std::string t;
    for (int i = chance(5) ? 1023 : pick(0, 40); i > 0; --i) {
      int c = pick(0, 99);
      char ch = c < 5 ? '\n' : c < 8 ? '\t' : static_cast<char>(pick(' ', '~'));
      if (ch == '"' && !comment) ch = '\'';
      if (ch == '/' && comment && !t.empty() && t.back() == '*') ch = '|';
      t += ch;
    }
    return t;
  }

  void grid(int* week) {
    std::fill(week, week + RJ_WEEK, 0);
    if (chance(30)) return;
    if (chance(30)) {
      for (int i = 0; i < RJ_WEEK; ++i) week[i] = chance(40) ? 1 : 0;
      return;
    }
    for (int n = pick(1, 4); n > 0; --n) {
      int d0 = pick(0, 6), d1 = pick(d0, 6), s0 = pick(0, 47), s1 = pick(s0, 47);
      for (int d = d0; d <= d1; ++d)
        for (int s = s0; s <= s1; ++s) week[d * 48 + s] = 1;
    }
  }

  void make_records() {
    std::vector<Dev*> devs;
    for (int i = pick(0, 6); i > 0; --i) {
      Dev* dev = Add_a_dev(nullptr, (word() + "_" + std::to_string(i)).c_str(), 1000 + i);
      ASSERT_NE(dev, nullptr);
      dev->lock_pid = chance(50) ? 0 : pick(-5, 99999);
      if (chance(50)) dev->comment.set(text(true).c_str());
      dev->host_name.set(word().c_str());
      dev->remote_location.set(text().c_str());
      dev->status = pick(LOCK_LOCKED, LOCK_SCHEDULE);
      dev->max_frames = pick(-3, 500);
      dev->num_processors = pick(0, 64);
      dev->default_dev = pick(0, 1);
      grid(dev->locks);
      devs.push_back(dev);
    }
    for (int i = pick(0, 12); i > 0; --i) {
      Job* job = Add_a_job(nullptr, (word() + ".sdl").c_str(), i * 7 + pick(0, 6));
      ASSERT_NE(job, nullptr);
      if (chance(60)) job->comment.set(text(true).c_str());
      job->lock_pid = chance(50) ? 0 : pick(1, 99999);
      job->del_when_done = pick(0, 1);
      job->user.set(word_or_none());
      job->status.set(text().c_str());
      job->priority = pick(-100, 100);
      job->executable.set(word_or_none());
      for (Text* field : {&job->sdl, &job->pix, &job->matte, &job->rnd_opts})
        field->set(chance(70) ? text().c_str() : nullptr);
      job->use_sdl_paths = pick(0, 1);
      job->output_mask = pick(0, 1);
      job->animate = chance(60) ? 1 : 0;
      // Multiples of 1/64 print exactly with six decimals.
      for (float& f : job->frames) f = static_cast<float>(pick(-64000, 640000)) / 64.0f;
      job->extension = chance(50) ? 0 : pick(1, 300);
      job->ext_start = pick(-10, 1000);
      job->ext_by = pick(-2, 10);
      job->ext_size = pick(0, 8);
      job->save_out = pick(0, 1);
      job->ctrl = pick(0, 5);
      job->fields = pick(0, 3);
      job->totalframes = pick(0, 100000);
      job->doneframes = pick(0, 100000);
      std::vector<Dev*> order = devs;
      std::shuffle(order.begin(), order.end(), rng);
      for (Dev* dev : order)
        if (chance(50)) RndDevList_add(job, dev);
      for (int n = pick(0, 3); n > 0; --n) RndPathList_add(job, text().c_str());
      grid(job->runs);
      job->deleted = chance(10) ? 1 : 0;
    }
  }

  std::string word_;
};

// What the format leaves out on purpose, applied to the records written.
void drop_unwritten(Job* jobs, Dev* devs) {
  for (Dev* dev = devs; dev != nullptr; dev = dev->next) dev->comment.reset();
  for (Job* job = jobs; job != nullptr; job = job->next) {
    if (job->animate == 0) {
      job->frames[0] = job->frames[1] = job->frames[2] = 0.0f;
      job->extension = job->save_out = job->fields = job->doneframes = 0;
      job->ctrl = RUN_AVAILABLE;
      job->rnd_opts.reset();
      job->totalframes = 1;
    } else if (job->ctrl != RUN_PAUSED && job->ctrl != RUN_SCHEDULE && job->ctrl != RUN_NOW) {
      job->ctrl = RUN_AVAILABLE;
    }
    if (job->extension == 0) {
      job->ext_start = 0;
      job->ext_by = job->ext_size = 1;
    } else {
      job->extension = 291;
    }
  }
}

TEST_P(RoundTripTest, WriteReadWriteIsStable) {
  ASSERT_NO_FATAL_FAILURE(make_records());
  rndctl.interval_min = static_cast<unsigned>(pick(0, 60));
  rndctl.interval_sec = static_cast<unsigned>(pick(0, 59));

  const std::string res_text = written_devs();
  const std::string job_text = written_jobs();
  EXPECT_THAT(res_text + job_text, Not(HasSubstr("(null)")));
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) EXPECT_EQ(job->deleted, 0);
  drop_unwritten(rndctl.jobs, rndctl.devs);
  // Without the comments nothing reads back; the jobs lose nothing written.
  const std::string res_expected = written_devs();
  EXPECT_EQ(written_jobs(), job_text);

  RndCtl aside;
  swap_lists(rndctl, aside);
  ASSERT_EQ(parse_devs(res_text), 0);
  ASSERT_EQ(parse(job_text), 0);
  EXPECT_EQ(written_devs(), res_expected);
  EXPECT_EQ(written_jobs(), job_text);

  Dev* a = aside.devs;
  Dev* b = rndctl.devs;
  for (; a != nullptr && b != nullptr; a = a->next, b = b->next)
    EXPECT_EQ(ISA_devdif(a, b), 0) << a->name.or_else("noname");
  EXPECT_TRUE(a == nullptr && b == nullptr) << "resource lists differ in length";
  Job* x = aside.jobs;
  Job* y = rndctl.jobs;
  for (; x != nullptr && y != nullptr; x = x->next, y = y->next)
    EXPECT_EQ(ISA_jobdif(x, y), 0) << x->name.or_else("noname");
  EXPECT_TRUE(x == nullptr && y == nullptr) << "job lists differ in length";

  delete_lists();
  swap_lists(rndctl, aside);
}

INSTANTIATE_TEST_SUITE_P(Seeds, RoundTripTest, testing::Range(1u, 41u));

}  // namespace
