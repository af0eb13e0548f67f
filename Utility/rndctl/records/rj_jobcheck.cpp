// Small services on job and resource records: unique indexes, settings read
// from a job's scene file, frame counts, owner and lock checks, and telling
// whether two copies of a record differ.
#include "Utility/rndctl/records/rj_jobcheck.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <span>
#include <vector>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_scoped.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_editreg.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"

namespace {

// Scene lines are read in pieces of at most 79 characters.
constexpr int kSceneLine = 80;

// The scan of a scene stops on a line that is a piece of the word
// ENVIRONMENT.  The test looks for the line inside the word, not the word
// inside the line: with the newline that a read line keeps, only a last line
// without one can match.  Scene files written by other tools rely on the
// scan going on past the environment section, so it stays this way round.
bool stops_scan(const char* line) { return strstr("ENVIRONMENT", line) != nullptr; }

ScopedFILE open_scene(const Job* job) {
  if (job == nullptr || job->sdl.none()) return nullptr;
  return ScopedFILE(fopen(job->sdl.c_str(), "r"));
}

const char* name_of(const Text& name) { return name.or_else("noname"); }

// A key a scene scan looks for, and what takes its value (the text after
// '=', cut at ';').  `take` returns false to end the scan there.
struct SceneKey {
  const char* key;
  bool (*take)(Job* job, const char* value);
};

// Reads the scene line by line up to the environment section and hands each
// line to the first of `keys` it holds (the order matters: keys match inside
// longer words).  With `until_all_seen` the scan also ends once every key has
// been taken.
void scan_scene(FILE* fp, Job* job, std::span<const SceneKey> keys, bool until_all_seen) {
  // A bit a key: the tables are a handful of keys long.
  const unsigned all = (1u << keys.size()) - 1u;
  unsigned seen = 0;
  char line[kSceneLine];
  while (fgets(line, sizeof line, fp) != nullptr) {
    if (stops_scan(line)) break;
    for (size_t i = 0; i < keys.size(); i++) {
      char* value = get_strstr(keys[i].key, line);
      if (value == nullptr) continue;
      if (!keys[i].take(job, value)) return;
      seen |= 1u << i;
      break;
    }
    if (until_all_seen && seen == all) break;
  }
}

bool take_float(float* to, const char* value) {
  *to = static_cast<float>(atof(value));
  return true;
}

bool take_int(int* to, const char* value) {
  *to = atoi(value);
  return true;
}

// Animation not ON ends the scan: the frame settings after it do not count.
bool take_animation(Job* job, const char* value) {
  job->animate = strstr(value, "ON") != nullptr ? 1 : 0;
  return job->animate != 0;
}

bool take_ext_start(Job* job, const char* value) { return take_int(&job->ext_start, value); }
bool take_ext_by(Job* job, const char* value) { return take_int(&job->ext_by, value); }

int count_frames(Job* job) {
  job->totalframes =
      job->animate != 0 ? Calc_frame_range(job->frames[0], job->frames[1], job->frames[2]) : 1;
  return job->totalframes;
}

}  // namespace

int RJCget_next_index(int file_id) {
  FileopLock lock(file_id);
  FILE* fp = update_fileop(file_id);
  int result = 1;
  if (fp != nullptr && fscanf(fp, "%d", &result) != 1) result = 1;
  // 0 asks the record constructors for a fresh index: never hand it out.
  if (result == 0) result = 1;
  unsigned store = static_cast<unsigned>(result) + 1u;
  if (store == 0) store = static_cast<unsigned>(result) + 2u;
  if (fp != nullptr) {
    rewind_fileop(file_id);
    // The letter l after the number is part of the file: readers stop at it.
    fprintf(fp, "%ul\n", store);
    (void)close_and_truncate_fileop(file_id);  // a failure is reported there; the old file stands
  }
  return result;
}

char* get_strstr(const char* key, char* line) {
  if (key == nullptr || line == nullptr) return nullptr;
  char* at = strstr(line, key);
  if (at == nullptr) return nullptr;
  char* equals = strchr(at, '=');
  if (equals == nullptr) return nullptr;
  char* semicolon = strchr(equals, ';');
  if (semicolon != nullptr) *semicolon = '\0';
  return equals + 1;
}

int Job_check_sdlfields(Job* job) {
  ScopedFILE fp = open_scene(job);
  if (fp == nullptr) return 0;
  // Ends once all three were read, or at fields not TRUE: the odd and even
  // lines after that do not count.
  static constexpr SceneKey kKeys[] = {
      {"fields",
       [](Job* j, const char* value) {
         j->fields = 0;
         return strstr(value, "TRUE") != nullptr;
       }},
      {"odd",
       [](Job* j, const char* value) {
         if (strstr(value, "FALSE") == nullptr) j->fields |= 1;
         return true;
       }},
      {"even",
       [](Job* j, const char* value) {
         if (strstr(value, "FALSE") == nullptr) j->fields |= 2;
         return true;
       }},
  };
  scan_scene(fp.get(), job, kKeys, true);
  return job->fields;
}

int Job_set_frame_range(Job* job) {
  ScopedFILE fp = open_scene(job);
  if (fp == nullptr) return 0;
  // Read to the end (or animation not ON): a key set twice takes its last value.
  static constexpr SceneKey kKeys[] = {
      {"animation", take_animation},
      {"startframe", [](Job* j, const char* value) { return take_float(&j->frames[0], value); }},
      {"endframe", [](Job* j, const char* value) { return take_float(&j->frames[1], value); }},
      {"byframe", [](Job* j, const char* value) { return take_float(&j->frames[2], value); }},
      {"start_extension", take_ext_start},
      {"by_extension", take_ext_by},
      {"extensionsize", [](Job* j, const char* value) { return take_int(&j->ext_size, value); }},
  };
  scan_scene(fp.get(), job, kKeys, false);
  return count_frames(job);
}

int Calc_frame_range(float start, float end, float step) {
  if (end == start || step == 0.0f) return 1;
  // Descending ranges count as one frame; the renderer is never asked to
  // walk backwards.
  if (end < start) return 1;
  int count = 0;
  float f = start;
  while (f < end) {
    count++;
    float next = f + step;
    if (next == f) break;  // the step vanished in the float's precision
    f = next;
  }
  // Accumulated rounding must not drop the end frame the range lands on.
  if (std::fabs(static_cast<double>(f) - static_cast<double>(end)) <=
      0.001 * static_cast<double>(step))
    count++;
  return count == 0 ? 1 : count;
}

int Job_check_sdl(Job* job) {
  ScopedFILE fp = open_scene(job);
  if (fp == nullptr) return 0;
  static constexpr SceneKey kAnimation[] = {{"animation", take_animation}};
  static constexpr SceneKey kWithExtension[] = {{"animation", take_animation},
                                                {"start_extension", take_ext_start},
                                                {"by_extension", take_ext_by}};
  // A job with its own extension settings keeps them: the scene's are not read.
  if (job->extension != 0) {
    scan_scene(fp.get(), job, kAnimation, true);
  } else {
    job->ext_by = 1;
    job->ext_start = static_cast<int>(job->frames[0]);
    scan_scene(fp.get(), job, kWithExtension, true);
  }
  return count_frames(job);
}

void Job_field_check() {
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
    if (job->user.none()) job->user.set(rndctl.user.c_str());
    // A holder that is no longer a registered editor has died; its lock goes.
    if (job->lock_pid != 0 && job->lock_pid != rndctl.pid)
      job->lock_pid = Editor_process_validate(job->lock_pid);
  }
}

int Job_file_search(const char* host) {
  if (host == nullptr) return 0;
  for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
    if (job->status.is("none") || job->status.is("failed") || job->status.is("aborted") ||
        job->status.is("finished"))
      continue;
    for (RndDevList* e = job->resources; e != nullptr; e = e->next)
      if (e->dev != nullptr && e->dev->host_name.is(host)) return 1;
  }
  return 0;
}

namespace {

// Copies of a record come from different lists, so linked records are
// compared by their index, not by address.
std::vector<int> job_indexes(const Dev* dev) {
  std::vector<int> v;
  for (const RndJobList* e = dev->jobs; e != nullptr; e = e->next)
    if (e->job != nullptr) v.push_back(e->job->index);
  std::sort(v.begin(), v.end());
  v.erase(std::unique(v.begin(), v.end()), v.end());
  return v;
}

bool same_dev(const Dev* a, const Dev* b) {
  if (a == b) return true;
  return a != nullptr && b != nullptr && a->index == b->index;
}

bool devlists_differ(const Job* a, const Job* b) {
  const RndDevList* x = a->resources;
  const RndDevList* y = b->resources;
  for (; x != nullptr && y != nullptr; x = x->next, y = y->next)
    if (!same_dev(x->dev, y->dev)) return true;
  return x != nullptr || y != nullptr;
}

bool pathlists_differ(const Job* a, const Job* b) {
  const RndPathList* x = a->searchpath;
  const RndPathList* y = b->searchpath;
  for (; x != nullptr && y != nullptr; x = x->next, y = y->next)
    if (rj_strcmp(x->path.c_str(), y->path.c_str()) != 0) return true;
  return x != nullptr || y != nullptr;
}

bool dev_fields_differ(const Dev* a, const Dev* b) {
  if (a->index != b->index || a->status != b->status || a->max_frames != b->max_frames ||
      a->num_processors != b->num_processors || a->lock_pid != b->lock_pid ||
      a->word1 != b->word1 || a->words[0] != b->words[0] || a->words[1] != b->words[1] ||
      a->word2 != b->word2 || a->default_dev != b->default_dev)
    return true;
  if (rj_strcmp(a->name.c_str(), b->name.c_str()) != 0 ||
      rj_strcmp(a->host_name.c_str(), b->host_name.c_str()) != 0 ||
      rj_strcmp(a->comment.c_str(), b->comment.c_str()) != 0 ||
      rj_strcmp(a->remote_location.c_str(), b->remote_location.c_str()) != 0)
    return true;
  if (!std::equal(a->locks, a->locks + RJ_WEEK, b->locks)) return true;
  return job_indexes(a) != job_indexes(b);
}

bool job_fields_differ(const Job* a, const Job* b) {
  if (a->index != b->index) return true;
  if (rj_strcmp(a->name.c_str(), b->name.c_str()) != 0 ||
      rj_strcmp(a->status.c_str(), b->status.c_str()) != 0)
    return true;
  if (a->priority != b->priority) return true;
  if (rj_strcmp(a->sdl.c_str(), b->sdl.c_str()) != 0) return true;
  if (a->use_sdl_paths != b->use_sdl_paths || a->output_mask != b->output_mask) return true;
  if (rj_strcmp(a->pix.c_str(), b->pix.c_str()) != 0 ||
      rj_strcmp(a->matte.c_str(), b->matte.c_str()) != 0)
    return true;
  if (a->animate != b->animate) return true;
  for (int i = 0; i < 3; i++)
    if (a->frames[i] != b->frames[i]) return true;
  if (a->extension != b->extension || a->ext_start != b->ext_start || a->ext_by != b->ext_by ||
      a->ext_size != b->ext_size)
    return true;
  if (a->totalframes != b->totalframes || a->doneframes != b->doneframes) return true;
  if (!std::equal(a->further, a->further + 4, b->further)) return true;
  if (rj_strcmp(a->comment.c_str(), b->comment.c_str()) != 0 ||
      rj_strcmp(a->executable.c_str(), b->executable.c_str()) != 0 ||
      rj_strcmp(a->rnd_opts.c_str(), b->rnd_opts.c_str()) != 0 ||
      rj_strcmp(a->user.c_str(), b->user.c_str()) != 0)
    return true;
  if (a->lock_pid != b->lock_pid || a->deleted != b->deleted ||
      a->del_when_done != b->del_when_done || a->save_out != b->save_out || a->ctrl != b->ctrl)
    return true;
  return !std::equal(a->runs, a->runs + RJ_WEEK, b->runs);
}

}  // namespace

// "differnt" is how the trace has always spelt it; log readers match on it.
int ISA_devdif(Dev* a, Dev* b) {
  if (a == b) return 0;
  if (a == nullptr || b == nullptr || dev_fields_differ(a, b)) {
    dbgpnt("\"%s\" is differnt from \"%s\"\n", a != nullptr ? name_of(a->name) : "noname",
           b != nullptr ? name_of(b->name) : "noname");
    return 1;
  }
  return 0;
}

int ISA_jobdif(Job* a, Job* b) {
  if (a == b) return 0;
  if (a == nullptr || b == nullptr || job_fields_differ(a, b)) {
    dbgpnt("\"%s\" is differnt from \"%s\"\n", a != nullptr ? name_of(a->name) : "noname",
           b != nullptr ? name_of(b->name) : "noname");
    return 1;
  }
  if (pathlists_differ(a, b)) {
    dbgpnt("\"%s\" pathlist is differnt from \"%s\"\n", name_of(a->name), name_of(b->name));
    return 1;
  }
  if (devlists_differ(a, b)) {
    dbgpnt("\"%s\" devlist is differnt from \"%s\"\n", name_of(a->name), name_of(b->name));
    return 1;
  }
  return 0;
}

void Editor_process_list(int mode) {
  std::vector<int> dead;
  Editor_registry_update(mode, &dead);
  for (int pid : dead) {
    for (Job* job = rndctl.jobs; job != nullptr; job = job->next) {
      if (job->lock_pid == pid) job->lock_pid = 0;
    }
    for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
      if (dev->lock_pid == pid) dev->lock_pid = 0;
    }
  }
}
