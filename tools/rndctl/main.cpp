// rndctl: the render queue from a shell.  Options and help come from CLI11;
// the commands themselves live in commands.cpp.
#include <CLI/CLI.hpp>
#include <cstdio>
#include <string>
#include <vector>

#include "tools/rndctl/commands.h"
#include "tools/rndctl/editor_side.h"
#if defined(RNDCTL_SERVE)
#include "tools/rndctl/serve.h"
#endif

namespace {

// What the options fill; one set per run, since one subcommand runs.
struct Parsed {
  std::string location, job;
  bool json = false, force = false;
  int result = 0;
  SubmitOptions submit;
  HostOptions host;
  std::vector<std::string> blocks;
  double timeout = 120;
  int task = -1;
  int interval = 500;
  std::string listen = "127.0.0.1:8470";
};

void add_json(CLI::App* c, Parsed& p) { c->add_flag("--json", p.json, "print JSON"); }
void add_force(CLI::App* c, Parsed& p) {
  c->add_flag("--force", p.force, "change it even when an editor holds it");
}
void add_job_arg(CLI::App* c, Parsed& p) {
  c->add_option("job", p.job, "job name or index")->required();
}

void add_submit(CLI::App& app, Parsed& p) {
  SubmitOptions& so = p.submit;
  auto* c = app.add_subcommand("submit", "queue a scene for rendering");
  c->add_option("scene", so.scene, "scene file")->required();
  c->add_option("--name", so.name, "job name (default: the scene's file name)");
  c->add_option("--frames", so.frames, "frame range START-END[:BY] (default: the scene's)");
  c->add_option("--hosts", so.hosts, "hosts H,H or all")->capture_default_str();
  c->add_option("--priority", so.priority, "priority (0 runs beside others)");
  c->add_option("--executable", so.executable, "render program");
  c->add_option("--pix", so.pix, "image output path");
  c->add_option("--matte", so.matte, "matte output path");
  c->add_option("--opts", so.opts, "options for the render program");
  c->add_option("--searchpath", so.searchpaths, "image search path (repeatable)");
  c->add_flag("--paused", so.paused, "queue it paused");
  c->add_flag("--delete-when-done", so.delete_when_done, "drop the job once finished");
  c->add_flag("--keep-output", so.keep_output, "keep the render program's output");
  c->add_option("--schedule", so.schedules, "run hours \"800-1700 Monday-Friday\" (repeatable)");
  c->callback([&p] { p.result = Cmd_submit(p.submit); });
}

void add_job_commands(CLI::App& app, Parsed& p) {
  auto* jobs = app.add_subcommand("jobs", "list the jobs");
  add_json(jobs, p);
  jobs->callback([&p] { p.result = Cmd_jobs(p.json); });

  auto* show = app.add_subcommand("show", "one job in full, with its tasks and log");
  add_job_arg(show, p);
  add_json(show, p);
  show->callback([&p] { p.result = Cmd_show(p.job, p.json); });

  for (const char* what : {"pause", "resume", "abort", "delete"}) {
    auto* c = app.add_subcommand(what, std::string(what) + " a job");
    add_job_arg(c, p);
    add_force(c, p);
    c->callback([&p, what] { p.result = Cmd_job_change(what, p.job, p.force); });
  }

  auto* restart = app.add_subcommand("restart", "render a job again from its first frame");
  add_job_arg(restart, p);
  add_force(restart, p);
  restart->add_option("--timeout", p.timeout, "seconds to wait for its running tasks to stop")
      ->capture_default_str();
  restart->callback([&p] { p.result = Cmd_restart(p.job, p.force, p.timeout); });

  auto* log = app.add_subcommand("log", "a job's log, or one task's record and output");
  add_job_arg(log, p);
  log->add_option("--task", p.task, "task id");
  log->callback([&p] { p.result = Cmd_log(p.job, p.task); });
}

void add_host_commands(CLI::App& app, Parsed& p) {
  auto* hosts = app.add_subcommand("hosts", "list the render hosts");
  add_json(hosts, p);
  hosts->callback([&p] { p.result = Cmd_hosts(p.json); });

  auto* host = app.add_subcommand("host", "change a render host");
  host->require_subcommand(1);
  for (const char* what : {"add", "set", "remove", "lock", "unlock"}) {
    auto* c = host->add_subcommand(what, std::string(what) + " a host");
    c->add_option("name", p.host.name, "resource name")->required();
    if (std::string(what) == "add" || std::string(what) == "set") {
      c->add_option("--host", p.host.host, "host name (default: the resource name)");
      c->add_option("--processors", p.host.processors, "render processes at a time");
      c->add_option("--frames", p.host.frames, "frames per task");
    }
    add_force(c, p);
    c->callback([&p, what] { p.result = Cmd_host_change(what, p.host, p.force); });
  }
  auto* sched = host->add_subcommand("schedule", "set the hours a host is locked");
  sched->add_option("name", p.host.name, "resource name")->required();
  sched->add_option("blocks", p.blocks, "\"2200-600 Monday-Friday\" ... (none: never locked)");
  add_force(sched, p);
  sched->callback([&p] { p.result = Cmd_host_schedule(p.host.name, p.blocks, p.force); });
}

void add_farm_commands(CLI::App& app, Parsed& p) {
  auto* check = app.add_subcommand("check", "put back dead hosts' tasks, drop dead editors' holds");
  add_json(check, p);
  check->callback([&p] { p.result = Cmd_check(p.json); });

  auto* watch = app.add_subcommand("watch", "a live view of the queue (q quits)");
  watch->add_option("--interval", p.interval, "milliseconds between looks at the files")
      ->check(CLI::Range(50, 10000));
  watch->callback([&p] { p.result = Cmd_watch(p.interval); });

#if defined(RNDCTL_SERVE)
  auto* serve = app.add_subcommand("serve", "the farm's status page in a browser (read-only)");
  serve->add_option("--listen", p.listen, "address and port to listen on")->capture_default_str();
  serve->callback([&p] { p.result = Cmd_serve(p.listen); });
#endif
}

}  // namespace

int main(int argc, char** argv) {
  PrgName = "rndctl";
  CLI::App app{"rndctl: the render queue from a shell"};
  app.require_subcommand(1);
  Parsed p;
  app.add_option("-l,--location", p.location,
                 "control directory (default: ZARNO_RNDCTL_LOCATION from the preferences)");
  add_submit(app, p);
  add_job_commands(app, p);
  add_host_commands(app, p);
  add_farm_commands(app, p);

  // The control block must be set up before any callback runs; without a
  // directory the run ends here as a user error.
  app.parse_complete_callback([&p] {
    std::string why;
    if (!Ctl_open(p.location.empty() ? nullptr : p.location.c_str(), &why))
      throw CLI::RuntimeError("rndctl: " + why, 1);
  });
  try {
    app.parse(argc, argv);
  } catch (const CLI::RuntimeError& e) {
    fprintf(stderr, "%s\n", e.what());
    return e.get_exit_code();
  } catch (const CLI::ParseError& e) {
    int code = app.exit(e);
    return code == 0 ? 0 : 2;
  }
  return p.result;
}
