// Records whose every string field holds an arbitrary text, written, read
// back and written again: the check shared by the unit tests and the
// control-file fuzzer.  The reader must give back exactly the text forms of
// the writer (rndctl.h), and what it gives back must write as the same text.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "Utility/rndctl/rndctl.h"

namespace text_records {

/// What `write(fp)` writes.
template <class Write>
std::string written(Write write) {
  char* buf = nullptr;
  size_t size = 0;
  FILE* fp = open_memstream(&buf, &size);
  if (fp == nullptr) return "<open_memstream failed>";
  write(fp);
  fclose(fp);
  std::string text(buf, size);
  free(buf);
  return text;
}

/// What Task_write writes of `groups`, marked when it reports a failure.
inline std::string written_tasks(TaskGroup* groups) {
  return written([groups](FILE* fp) {
    if (Task_write(fp, groups) != 0) fputs("<Task_write failed>", fp);
  });
}

/// The groups Task_read finds in `text`.
inline TaskGroup* read_tasks(const std::string& text) {
  FILE* fp = tmpfile();
  if (fp == nullptr) return nullptr;
  fwrite(text.data(), 1, text.size(), fp);
  rewind(fp);
  TaskGroup* groups = Task_read(fp);
  fclose(fp);
  return groups;
}

inline void delete_lists() {
  while (rndctl.jobs != nullptr) Job_del(rndctl.jobs);
  while (rndctl.devs != nullptr) Dev_del(rndctl.devs);
}

inline void swap_lists(RndCtl& a, RndCtl& b) {
  std::swap(a.jobs, b.jobs);
  std::swap(a.devs, b.devs);
  std::swap(a.job_index, b.job_index);
  std::swap(a.dev_index, b.dev_index);
  std::swap(a.dev_name_index, b.dev_name_index);
}

/// Builds a resource, a second plain resource, a job holding the texts in every string field and
/// a job without a name, and checks the property.  `texts` is used round-robin (empty: every
/// field ""); the lists must be empty, and are empty again afterwards.  Returns "" when it
/// holds, else what went wrong.
inline std::string check(const std::vector<std::string>& texts) {
  size_t next = 0;
  auto t = [&]() -> std::string {
    return texts.empty() ? std::string() : texts[next++ % texts.size()];
  };
  std::string failure;
  auto fail = [&](const std::string& what) {
    if (failure.empty()) failure = what;
  };

  Dev* odd = Dev_new(nullptr, nullptr, t().c_str(), 1);
  Dev* plain = Dev_new(nullptr, nullptr, "plainhost", 2);
  Job* job = Job_new(nullptr, nullptr, "scene.sdl", 1);
  Job* nameless = Job_new(nullptr, nullptr, nullptr, 2);
  if (odd == nullptr || plain == nullptr || job == nullptr || nameless == nullptr)
    return "out of memory";
  // Each text is kept for the forms below: the records may not give it back.
  std::vector<std::string> held;
  auto fill = [&](Text& field) { field.set((held.emplace_back(t())).c_str()); };
  for (Text* f : {&odd->host_name, &odd->remote_location, &odd->comment, &job->name, &job->comment,
                  &job->user, &job->status, &job->executable, &job->sdl, &job->pix, &job->matte,
                  &job->rnd_opts})
    fill(*f);
  const std::string host = held[0], location = held[1], name = held[3], comment = held[4],
                    user = held[5], exe = held[7];
  std::tie(job->animate, job->frames[0], job->frames[1], job->frames[2]) = std::tuple(1, 1, 10, 1);
  for (int i = 0; i < 2; ++i) RndPathList_add(job, t().c_str());
  for (auto [on, dev] : {std::pair{job, odd}, {job, plain}, {nameless, plain}})
    RndDevList_add(on, dev);

  const std::string devs_text = written(Resource_control_write_dev);
  const std::string jobs_text = written(Job_control_write_dev);

  // The same records in the forms the reader is to give back.
  Dev_set_name(odd, RJC_name_form(odd->name.c_str()).c_str());
  odd->host_name.set(RJC_name_form(host.c_str()).c_str());
  odd->remote_location.set(RJC_string_form(location.c_str()).c_str());
  odd->comment.reset();  // a resource comment is written, never read
  job->name.set(RJC_name_form(name.substr(name.rfind('/') + 1).c_str()).c_str());
  job->comment.set(RJC_comment_form(comment.c_str()).c_str());
  job->user.set(RJC_name_form(user.c_str()).c_str());
  job->executable.set(RJC_name_form(exe.c_str()).c_str());
  for (Text* field : {&job->status, &job->sdl, &job->pix, &job->matte, &job->rnd_opts})
    field->set(RJC_string_form(field->c_str()).c_str());
  for (RndPathList* p = job->searchpath; p != nullptr; p = p->next)
    p->path.set(RJC_string_form(p->path.c_str()).c_str());
  nameless->name.set("");
  // The forms are fixed points: the sanitised jobs write the same text.
  if (written(Job_control_write_dev) != jobs_text) fail("sanitised jobs write differently");
  const std::string devs_expected = written(Resource_control_write_dev);

  // The task file of the two jobs, written from the forms the job file gives back.
  TaskGroup* groups = TaskGroup_alloc(job, 3);
  if (groups == nullptr) return "out of memory";
  groups->next = TaskGroup_alloc(nameless, 1);
  TaskRec_alloc(groups, 1.0f, 4.0f, 2.0f, odd, TASK_RUNNING, nullptr, 1);
  TaskRec_alloc(groups, 5.0f, 10.0f, 5.0f, plain, TASK_PENDING, nullptr, 2);
  TaskRec_alloc(groups->next, 1.0f, 1.0f, 1.0f, plain, TASK_FAILED, nullptr, 0);
  const std::string tasks_text = written_tasks(groups);
  TaskGroup_free_all(&groups);

  RndCtl aside;
  swap_lists(rndctl, aside);
  if (RJC_parse_string(devs_text.data(), devs_text.size(), "Render_Resource_Control") != 0)
    fail("resource file does not parse:\n" + devs_text);
  if (RJC_parse_string(jobs_text.data(), jobs_text.size(), "Render_Job_Control") != 0)
    fail("job file does not parse:\n" + jobs_text);

  auto compare = [&](auto* a, auto* b, auto dif, const std::string& what) {
    for (; a != nullptr && b != nullptr; a = a->next, b = b->next)
      if (dif(a, b) != 0) fail(what + " " + std::to_string(a->index) + " differs");
    if (a != nullptr || b != nullptr) fail(what + " lists differ in length");
  };
  compare(aside.devs, rndctl.devs, ISA_devdif, "resource");
  compare(aside.jobs, rndctl.jobs, ISA_jobdif, "job");
  if (written(Resource_control_write_dev) != devs_expected) fail("resource file not stable");
  if (written(Job_control_write_dev) != jobs_text) fail("job file not stable");

  // The task file reads back group by group, each under its job's index.
  TaskGroup* read = read_tasks(tasks_text);
  // The reader gives the groups in an order of its own: compared by index.
  int seen[2] = {0, 0};
  TaskGroup* by_index[2] = {nullptr, nullptr};
  for (TaskGroup* g = read; g != nullptr; g = g->next) {
    if (g->job == nullptr || g->job->index < 1 || g->job->index > 2) continue;
    by_index[g->job->index - 1] = g;
    for (TaskRec* r = g->tasks; r != nullptr; r = r->next) ++seen[g->job->index - 1];
  }
  if (seen[0] != 2 || seen[1] != 1) fail("task file groups misread:\n" + tasks_text);
  std::string again;
  for (TaskGroup* g : by_index) {
    if (g == nullptr) continue;
    TaskGroup* after = std::exchange(g->next, nullptr);
    again += written_tasks(g);
    g->next = after;
  }
  if (again != tasks_text) fail("task file not stable:\n" + tasks_text + "--\n" + again);
  TaskGroup_free_all(&read);

  delete_lists();
  swap_lists(rndctl, aside);
  delete_lists();
  return failure;
}

}  // namespace text_records
