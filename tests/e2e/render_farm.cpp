#include "tests/e2e/render_farm.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <functional>
#include <thread>

std::string resource_file(const std::vector<ResourceSpec>& resources) {
  std::string out = "RenderResourceControl\n";
  char line[512];
  for (const auto& r : resources) {
    snprintf(line, sizeof line,
             "%s %d {\n\tlock_pid \t= 0;\n\thost_name\t\t= %s;\n\tstatus \t\t\t= %s;\n"
             "\tmax_frames \t\t= %d;\n\tnum_processors \t= %d;\n  default_dev     = 0;\n",
             r.name.c_str(), r.index, r.name.c_str(), r.status.c_str(), r.max_frames,
             r.num_processors);
    out += line;
    if (!r.locks.empty()) out += "\tlocks =" + r.locks + ";\n";
    out += "\t}\n\n";
  }
  return out + "End\n";
}

std::string job_file(const std::vector<JobSpec>& jobs, const std::string& scene) {
  std::string out = "RenderJobControl 0 0\n";
  char line[1024];
  for (const auto& j : jobs) {
    snprintf(line, sizeof line,
             "%s %d {\n\tuser\t \t= tester;\n\tstatus \t\t= \"%s\";\n\tpriority \t= %d;\n"
             "\texecutable \t= %s;\n\tsdl \t\t= \"%s\";\n\tpix \t\t= \"pix/%s\";\n"
             "\tuse_sdl_paths = FALSE;\n\toutput_mask = FALSE;\n\tanimate\t\t= TRUE;\n"
             "\tframes\t\t= %f, %f, %f;\n",
             j.name.c_str(), j.index, j.status.c_str(), j.priority, j.executable.c_str(),
             scene.c_str(), j.name.c_str(), j.start, j.end, j.by);
    out += line;
    if (j.save_out) out += "\tsave_out\t= TRUE;\n";
    if (!j.ctrl.empty()) out += "\tctrl\t\t= " + j.ctrl + ";\n";
    if (!j.opts.empty()) out += "\trnd_opts\t= \"" + j.opts + "\";\n";
    int total = static_cast<int>((j.end - j.start) / j.by) + 1;
    snprintf(line, sizeof line, "\ttotalframes\t= %d;\n\tdoneframes\t= 0;\n", total);
    out += line;
    if (!j.hosts.empty()) {
      out += "\tresources\t=";
      for (size_t i = 0; i < j.hosts.size(); ++i) out += (i ? ", " : " ") + j.hosts[i];
      out += ";\n";
    }
    if (!j.runs.empty()) out += "\truns\t\t=" + j.runs + ";\n";
    out += "}\n\n";
  }
  return out + "End\n";
}

std::vector<FileRec> task_records(Farm& farm) {
  std::vector<FileRec> recs;
  std::string text = farm.read("Render_Tasks");
  for (size_t at = 0; (at = text.find("\n\t", at)) != std::string::npos;) {
    FileRec r{};
    char status[32];
    if (sscanf(text.c_str() + ++at + 1, "%d %f %f %f %d %d %31s", &r.id, &r.start, &r.end,
               &r.current, &r.dev, &r.retries, status) == 7)
      recs.push_back((r.status = status, r));
  }
  return recs;
}

bool job_finishes(Farm& farm, Daemon& d, double seconds, const std::string& job) {
  auto done = [&] { return job_status(farm, job) == "finished"; };
  return wait_for([&] { return done() || d.ended(); }, seconds, &d) && done();
}

std::vector<std::string> lock_dirs(Farm& farm) {
  std::vector<std::string> locks = dir_names(farm.dir());
  std::erase_if(locks, [](const std::string& name) { return !name.ends_with(".lock"); });
  return locks;
}

std::string make_project(Farm& farm) {
  std::string project = farm.path("project"), scene = project + "/sdl/scene.sdl";
  for (const char* dir : {"", "/sdl", "/pix"}) mkdir((project + dir).c_str(), 0777);
  write_text_file(scene,
                  "animation = ON;\nstartframe = 1;\nendframe = 6;\nbyframe = 1;\n"
                  "extensionsize = 4;\nsize = 16x12;\n");
  return scene;
}

std::vector<std::string> render_env() {
  std::string painter = FRAME_PAINTER_PATH, stamper = STAMP_RENDER_PATH;
  const char* path = getenv("PATH");
  return {"PATH=" + painter.substr(0, painter.rfind('/')) + ":" +
          stamper.substr(0, stamper.rfind('/')) + ":" + (path != nullptr ? path : "/usr/bin:/bin")};
}

std::string job_block(Farm& farm, const std::string& job) {
  std::string text = farm.read("Render_Job_Control");
  size_t at = text.find("\n" + job + " ");
  if (at == std::string::npos) return "";
  size_t end = text.find("\n}\n", at);
  return text.substr(at + 1, end == std::string::npos ? std::string::npos : end - at);
}

std::string job_status(Farm& farm, const std::string& job) {
  std::string block = job_block(farm, job);
  size_t at = block.find("\tstatus \t\t= \"");
  if (at == std::string::npos) return "";
  at += strlen("\tstatus \t\t= \"");
  return block.substr(at, block.find('"', at) - at);
}

bool take_lock(Farm& farm, const std::string& file, double seconds) {
  std::string lock = farm.path(file + ".lock");
  return wait_for([&] { return mkdir(lock.c_str(), 0777) == 0; }, seconds);
}

void drop_lock(Farm& farm, const std::string& file) { rmdir(farm.path(file + ".lock").c_str()); }

namespace {
// Applies `edit` to the job file's text under its lock as an editor does, writes the text back
// when the edit found what it looked for, then touches the pid file of `host`.
bool edit_locked(Farm& farm, const std::string& host,
                 const std::function<bool(std::string&)>& edit) {
  if (!take_lock(farm, "Render_Job_Control")) return false;
  std::string text = farm.read("Render_Job_Control");
  bool found = edit(text);
  if (found) farm.write("Render_Job_Control", text);
  drop_lock(farm, "Render_Job_Control");
  utimensat(AT_FDCWD, farm.path(host + ".pid").c_str(), nullptr, 0);
  return found;
}
}  // namespace

bool edit_job_file(Farm& farm, const std::string& from, const std::string& to,
                   const std::string& host) {
  return edit_locked(farm, host, [&](std::string& text) {
    size_t at = text.find(from);
    return at != std::string::npos && (text.replace(at, from.size(), to), true);
  });
}

bool set_job_status(Farm& farm, const std::string& job, const std::string& status,
                    const std::string& host) {
  // The status line is looked for inside the job's own block: another job
  // may show the very same line.
  const std::string key = "\tstatus \t\t= \"";
  return edit_locked(farm, host, [&](std::string& text) {
    size_t block = text.find("\n" + job + " ");
    size_t at = block == std::string::npos ? block : text.find(key, block);
    size_t end = at == std::string::npos ? at : text.find(";\n", at);
    return end != std::string::npos && (text.replace(at, end - at, key + status + "\""), true);
  });
}
