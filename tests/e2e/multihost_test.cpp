// Several render hosts on one machine: each daemon in its own UTS namespace
// under its own host name, all on one control directory.
#include <unistd.h>

#include <map>
#include <set>

#include "tests/e2e/render_farm.h"

namespace {

TEST(MultiHost, TwoHostsShareAJobWithoutRenderingAFrameTwice) {
  if (!can_name_hosts())
    GTEST_SKIP() << "needs root or user namespaces: daemons run under other host names";
  Farm farm;
  std::string scene = make_project(farm);
  ResourceSpec a{"hostA", 1, 2, 1, "AVAILABLE", ""};
  ResourceSpec b{"hostB", 2, 2, 1, "AVAILABLE", ""};
  JobSpec spin;
  spin.start = 1;
  spin.end = 12;
  spin.opts = "slow=1";  // long enough for both hosts to get a share
  spin.hosts = {"hostA", "hostB"};
  farm.write("Render_Resource_Control", resource_file({a, b}));
  farm.write("Render_Job_Control", job_file({spin}, scene));

  Daemon& da = farm.start_on_farm({}, "hostA", render_env());
  Daemon& db = farm.start_on_farm({}, "hostB", render_env());
  ASSERT_TRUE(wait_for([&] { return job_status(farm, "spin") == "finished"; }, 120, &da))
      << da.log() << db.log();
  EXPECT_FALSE(da.ended());
  EXPECT_FALSE(db.ended());

  // The job log lists every task with the host that rendered it.
  std::string log = farm.read("JOBLOG/spin");
  std::set<int> frames;
  std::map<std::string, int> per_host;
  size_t at = 0;
  while ((at = log.find("\n\t", at)) != std::string::npos) {
    int id, e0, e1;
    float s, e;
    char dev[64], status[32];
    if (sscanf(log.c_str() + at + 2, "%d %f - %f %d - %d %63s %31s", &id, &s, &e, &e0, &e1, dev,
               status) == 7 &&
        std::string(status) == "FINISHED") {
      for (int f = static_cast<int>(s); f <= static_cast<int>(e); ++f) {
        EXPECT_TRUE(frames.insert(f).second) << "frame " << f << " twice\n" << log;
      }
      per_host[dev] += 1;
    }
    ++at;
  }
  EXPECT_EQ(frames.size(), 12u) << log;
  EXPECT_GT(per_host["hostA"], 0) << log;
  EXPECT_GT(per_host["hostB"], 0) << log;
  for (int f = 1; f <= 12; ++f) {
    EXPECT_EQ(access((farm.path("project/pix/spin.") + std::to_string(f)).c_str(), F_OK), 0) << f;
  }
}

}  // namespace
