// Several render hosts on one machine: each daemon in its own UTS namespace
// under its own host name, all on one control directory.
#include <unistd.h>

#include <map>

#include "tests/e2e/render_farm.h"

namespace {

TEST(MultiHost, TwoHostsShareAJobWithoutRenderingAFrameTwice) {
  if (!can_name_hosts())
    GTEST_SKIP() << "needs root or user namespaces: daemons run under other host names";
  Farm farm;
  farm.write("Render_Resource_Control", resource_file({{"hostA", 1, 2, 1}, {"hostB", 2, 2, 1}}));
  // Frames slow enough for both hosts to get a share.
  farm.write(
      "Render_Job_Control",
      job_file({{.end = 12, .opts = "slow=1", .hosts = {"hostA", "hostB"}}}, make_project(farm)));
  Daemon& da = farm.start_on_farm({}, "hostA", render_env());
  Daemon& db = farm.start_on_farm({}, "hostB", render_env());
  ASSERT_TRUE(job_finishes(farm, da)) << da.log() << db.log();
  EXPECT_FALSE(da.ended() || db.ended());

  // The job log lists every task with the host that rendered it.  Frame f is
  // at f - 1 of `frames`: '#' once rendered, '2' when rendered again.
  const std::string log = farm.read("JOBLOG/spin");
  std::string frames(12, '-');
  std::map<std::string, int> per_host;
  for (size_t at = 0; (at = log.find("\n\t", at)) != std::string::npos; ++at) {
    int id, e0, e1;
    float s, e;
    char dev[64], status[32];
    if (sscanf(log.c_str() + at + 2, "%d %f - %f %d - %d %63s %31s", &id, &s, &e, &e0, &e1, dev,
               status) != 7 ||
        std::string(status) != "FINISHED")
      continue;
    for (int f = static_cast<int>(s); f <= static_cast<int>(e); ++f)
      frames.at(f - 1) = frames.at(f - 1) == '-' ? '#' : '2';
    per_host[dev] += 1;
  }
  EXPECT_EQ(frames, std::string(12, '#')) << log;
  EXPECT_TRUE(per_host["hostA"] > 0 && per_host["hostB"] > 0) << log;
  for (int f = 1; f <= 12; ++f)
    EXPECT_EQ(access(farm.path("project/pix/spin." + std::to_string(f)).c_str(), F_OK), 0) << f;
}

}  // namespace
