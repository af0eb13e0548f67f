// rndctl: the render queue from a shell.  Options and help come from CLI11;
// the commands themselves live in commands.cpp.
#include <CLI/CLI.hpp>
#include <cstdio>
#include <string>

#include "tools/rndctl/commands.h"
#include "tools/rndctl/editor_side.h"
#if defined(RNDCTL_SERVE)
#include "tools/rndctl/serve.h"
#endif

int main(int argc, char** argv) {
  PrgName = "rndctl";
  CLI::App app{"rndctl: the render queue from a shell"};
  app.require_subcommand(1);
  std::string location;
  app.add_option("-l,--location", location,
                 "control directory (default: ZARNO_RNDCTL_LOCATION from the preferences)");

  bool json = false, force = false;
  std::string job;
  int result = 0;
  auto add_json = [&](CLI::App* c) { c->add_flag("--json", json, "print JSON"); };

  SubmitOptions so;
  auto* submit = app.add_subcommand("submit", "queue a scene for rendering");
  submit->add_option("scene", so.scene, "scene file")->required();
  submit->add_option("--name", so.name, "job name (default: the scene's file name)");
  submit->add_option("--frames", so.frames, "frame range START-END[:BY] (default: the scene's)");
  submit->add_option("--hosts", so.hosts, "hosts H,H or all")->capture_default_str();
  submit->add_option("--priority", so.priority, "priority (0 runs beside others)");
  submit->add_option("--executable", so.executable, "render program");
  submit->add_option("--pix", so.pix, "image output path");
  submit->add_option("--matte", so.matte, "matte output path");
  submit->add_option("--opts", so.opts, "options for the render program");
  submit->add_option("--searchpath", so.searchpaths, "image search path (repeatable)");
  submit->add_flag("--paused", so.paused, "queue it paused");
  submit->add_flag("--delete-when-done", so.delete_when_done, "drop the job once finished");
  submit->add_flag("--keep-output", so.keep_output, "keep the render program's output");
  submit->add_option("--schedule", so.schedules,
                     "run hours \"800-1700 Monday-Friday\" (repeatable)");
  submit->callback([&] { result = Cmd_submit(so); });

  auto* jobs = app.add_subcommand("jobs", "list the jobs");
  add_json(jobs);
  jobs->callback([&] { result = Cmd_jobs(json); });

  auto* show = app.add_subcommand("show", "one job in full, with its tasks and log");
  show->add_option("job", job, "job name or index")->required();
  add_json(show);
  show->callback([&] { result = Cmd_show(job, json); });

  for (const char* what : {"pause", "resume", "abort", "delete"}) {
    auto* c = app.add_subcommand(what, std::string(what) + " a job");
    c->add_option("job", job, "job name or index")->required();
    c->add_flag("--force", force, "change it even when an editor holds it");
    c->callback([&, what] { result = Cmd_job_change(what, job, force); });
  }

  double timeout = 120;
  auto* restart = app.add_subcommand("restart", "render a job again from its first frame");
  restart->add_option("job", job, "job name or index")->required();
  restart->add_flag("--force", force, "change it even when an editor holds it");
  restart->add_option("--timeout", timeout, "seconds to wait for its running tasks to stop")
      ->capture_default_str();
  restart->callback([&] { result = Cmd_restart(job, force, timeout); });

  auto* hosts = app.add_subcommand("hosts", "list the render hosts");
  add_json(hosts);
  hosts->callback([&] { result = Cmd_hosts(json); });

  HostOptions ho;
  auto* host = app.add_subcommand("host", "change a render host");
  host->require_subcommand(1);
  for (const char* what : {"add", "set", "remove", "lock", "unlock"}) {
    auto* c = host->add_subcommand(what, std::string(what) + " a host");
    c->add_option("name", ho.name, "resource name")->required();
    if (std::string(what) == "add" || std::string(what) == "set") {
      c->add_option("--host", ho.host, "host name (default: the resource name)");
      c->add_option("--processors", ho.processors, "render processes at a time");
      c->add_option("--frames", ho.frames, "frames per task");
    }
    c->add_flag("--force", force, "change it even when an editor holds it");
    c->callback([&, what] { result = Cmd_host_change(what, ho, force); });
  }
  std::vector<std::string> blocks;
  auto* sched = host->add_subcommand("schedule", "set the hours a host is locked");
  sched->add_option("name", ho.name, "resource name")->required();
  sched->add_option("blocks", blocks, "\"2200-600 Monday-Friday\" ... (none: never locked)");
  sched->add_flag("--force", force, "change it even when an editor holds it");
  sched->callback([&] { result = Cmd_host_schedule(ho.name, blocks, force); });

  auto* check = app.add_subcommand("check", "put back dead hosts' tasks, drop dead editors' holds");
  add_json(check);
  check->callback([&] { result = Cmd_check(json); });

  int task = -1;
  auto* log = app.add_subcommand("log", "a job's log, or one task's record and output");
  log->add_option("job", job, "job name or index")->required();
  log->add_option("--task", task, "task id");
  log->callback([&] { result = Cmd_log(job, task); });

  int interval = 500;
  auto* watch = app.add_subcommand("watch", "a live view of the queue (q quits)");
  watch->add_option("--interval", interval, "milliseconds between looks at the files")
      ->check(CLI::Range(50, 10000));
  watch->callback([&] { result = Cmd_watch(interval); });

#if defined(RNDCTL_SERVE)
  std::string listen = "127.0.0.1:8470";
  auto* serve = app.add_subcommand("serve", "the farm's status page in a browser (read-only)");
  serve->add_option("--listen", listen, "address and port to listen on")->capture_default_str();
  serve->callback([&] { result = Cmd_serve(listen); });
#endif

  // The control block must be set up before any callback runs.
  app.parse_complete_callback([&] { Ctl_open(location.empty() ? nullptr : location.c_str()); });
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? 0 : 2;
  }
  return result;
}
