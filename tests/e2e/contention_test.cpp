// Eight hosts race for the one-frame tasks of one job of very short frames:
// the task file's lock is all that keeps two hosts from taking the same task.
// Once on a local directory, once with every host on its own network mount
// (own attribute cache, whole-second stamps).
#include <map>

#include "tests/e2e/farm_hosts.h"
#include "tests/e2e/render_farm.h"

namespace {

class Contention : public ::testing::TestWithParam<bool> {};

TEST_P(Contention, EightHostsRenderEveryFrameOfOneJobExactlyOnce) {
  if (!can_name_hosts()) GTEST_SKIP() << kCannotNameHosts;
  SshServer ssh;
  std::string why;
  if (GetParam() && !ssh.start(&why)) GTEST_SKIP() << "no network mounts here: " << why;
  constexpr int kFrames = 64;
  Farm farm;
  std::string scene = make_project(farm);
  FarmHosts hosts(farm, GetParam() ? &ssh : nullptr);
  std::vector<std::string> names;
  std::vector<ResourceSpec> resources;
  for (int i = 0; i < 8; ++i) {
    names.push_back("race" + std::to_string(i));
    resources.push_back({names.back(), i + 1, 1, 1});
  }
  std::string stamps = farm.path("../stamps");
  JobSpec job{.name = "race",
              .end = kFrames,
              .opts = "sleep=0.05 stamp=" + stamps,
              .hosts = names,
              .executable = "stamp_render"};
  farm.write("Render_Resource_Control", resource_file(resources));
  farm.write("Render_Job_Control", job_file({job}, scene));

  for (const auto& h : names) ASSERT_TRUE(hosts.start(h)) << h;
  bool finished = hosts.wait_until([&] { return job_status(farm, "race") == "finished"; }, 150);
  EXPECT_TRUE(finished) << "job is \"" << job_status(farm, "race") << "\"\n"
                        << farm.read("Render_Tasks");

  std::map<int, std::string> where;
  std::string twice, missing;
  for (const Stamp& s : read_stamps(stamps)) {
    int f = static_cast<int>(s.frame);
    if (where.count(f) != 0) twice += " " + std::to_string(f) + "(" + where[f] + "," + s.host + ")";
    where[f] += s.host;
  }
  for (int f = 1; f <= kFrames; ++f) missing += where.count(f) == 0 ? " " + std::to_string(f) : "";
  EXPECT_TRUE(twice.empty()) << "frames rendered twice:" << twice;
  EXPECT_TRUE(missing.empty()) << "frames never rendered:" << missing;
  EXPECT_TRUE(hosts.shut_down(30).empty()) << "a daemon did not leave when stopped";
}

INSTANTIATE_TEST_SUITE_P(Mounts, Contention, ::testing::Values(false, true), mount_name);

}  // namespace
