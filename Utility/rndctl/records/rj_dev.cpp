// Resource records ("devs", one per render host as the queue sees it):
// making, finding, inserting and deleting them, lock-state words, and the
// field checks that drop locks of dead editors.
#include "Utility/rndctl/records/rj_dev.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <unordered_map>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_editreg.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_updatetime.h"
#include "Utility/rndctl/records/rj_jobcheck.h"
#include "Utility/rndctl/records/rj_lst.h"
#include "Utility/rndctl/records/rj_recindex.h"
#include "Utility/rndctl/records/rj_records.h"

namespace {

const char* const kUnit = "Utility/rndctl/rj_dev";

// The allocator trace names every resource by this tag.
constexpr int kDevTag = 141;

auto index_is(int index) {
  return [index](const Dev* d) { return d->index == index; };
}

auto name_is(const std::string& name) {
  return [&name](const Dev* d) { return d->name.is(name.c_str()); };
}

// The name each resource is filed under in rndctl.dev_name_index.  Kept by
// record rather than read back from the record, so that a delete finds the
// right slot even if the name was changed without Dev_set_name.  Keyed by
// pointer, so it is indifferent to which list (current or set aside) the
// record is in.
std::unordered_map<const Dev*, std::string>& filed_names() {
  static auto* names = new std::unordered_map<const Dev*, std::string>;
  return *names;
}

void file_name(Dev* dev) {
  if (dev->name.none()) return;
  std::string key = dev->name.c_str();
  recindex_add(rndctl.dev_name_index, key, dev);
  filed_names()[dev] = std::move(key);
}

void unfile_name(Dev* dev) {
  auto it = filed_names().find(dev);
  if (it == filed_names().end()) return;
  const std::string key = std::move(it->second);
  filed_names().erase(it);
  recindex_remove(rndctl.dev_name_index, key, dev, rndctl.devs, name_is(key));
}

Dev* tail_hint = nullptr;  // non-owning; see Job_new for why
Dev* tail_head = nullptr;  // compared, never followed

void clear_listitem_backlink(void* item, const void* record) {
  if (item == nullptr) return;
  void** words = static_cast<void**>(item);
  if (words[2] == record) words[2] = nullptr;
}

}  // namespace

Dev* Dev_new(Dev* before, void* listitem, const char* name, int index) {
  Dev* dev = MA_new<Dev>(kDevTag, kUnit);
  if (dev == nullptr) return nullptr;

  dev->index = index != 0 ? index : RJCget_next_index(FILE_DEV_INDEX);
  if (name != nullptr && strcmp(name, "new_resource") == 0) {
    char numbered[64];
    snprintf(numbered, sizeof numbered, "%s_%lu", name, static_cast<unsigned long>(dev->index));
    dev->name.set(numbered);
  } else {
    dev->name.set(name);
  }
  dev->host_name.set(rndctl.host.c_str());
  const char* tmp = getenv("DRCTMPDIR");
  dev->remote_location.set(tmp != nullptr ? tmp : "/usr/tmp");
  dev->status = LOCK_SCHEDULE;
  dev->listitem = listitem;
  dev->max_frames = 4;
  dev->num_processors = 0;

  if (before != nullptr) {
    dev->next = before;
    dev->prev = before->prev;
    if (before->prev != nullptr)
      before->prev->next = dev;
    else
      rndctl.devs = dev;
    before->prev = dev;
  } else if (rndctl.devs == nullptr) {
    rndctl.devs = dev;
  } else {
    Dev* last = rndctl.devs;
    if (tail_hint != nullptr && tail_head == rndctl.devs) last = tail_hint;
    while (last->next != nullptr) last = last->next;
    last->next = dev;
    dev->prev = last;
  }
  if (dev->next == nullptr) {
    tail_hint = dev;
    tail_head = rndctl.devs;
  }
  recindex_add(rndctl.dev_index, dev->index, dev);
  file_name(dev);
  return dev;
}

Dev* Add_a_dev(void* listitem, const char* name, int index) {
  Dev* found = Dev_by_index(index);
  if (found != nullptr) return found;
  return Dev_new(nullptr, listitem, name, index);
}

Dev* Insert_a_dev(Dev* before, void* listitem, const char* name, int index) {
  Dev* found = Dev_by_index(index);
  if (found != nullptr) return found;
  return Dev_new(before, listitem, name, index);
}

Dev* Dev_by_name(const char* name) {
  if (name == nullptr) return nullptr;
  const std::string key = name;
  // A miss walks too: 500 resources are cheap to walk, and a name that was
  // set behind the table's back must still be found.
  return recindex_find(rndctl.dev_name_index, key, rndctl.devs, name_is(key), true);
}

Dev* Dev_by_index(int index) {
  return recindex_find(rndctl.dev_index, index, rndctl.devs, index_is(index), false);
}

Dev* dev_by_listitem(void* item) {
  for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next)
    if (dev->listitem == item) return dev;
  return nullptr;
}

void Dev_set_name(Dev* dev, const char* name) {
  if (dev == nullptr) return;
  unfile_name(dev);
  dev->name.set(name);
  file_name(dev);
}

Dev* Dev_del(Dev* dev) {
  if (dev == nullptr) return nullptr;
  Dev* neighbour = dev->prev != nullptr ? dev->prev : dev->next;

  if (dev->prev != nullptr)
    dev->prev->next = dev->next;
  else if (rndctl.devs == dev)
    rndctl.devs = dev->next;
  if (dev->next != nullptr) dev->next->prev = dev->prev;
  dev->next = dev->prev = nullptr;
  if (tail_hint == dev) tail_hint = nullptr;
  recindex_remove(rndctl.dev_index, dev->index, dev, rndctl.devs, index_is(dev->index));
  unfile_name(dev);
  if (rndctl.current_dev == dev) rndctl.current_dev = nullptr;

  // Taking the resource out of each job's pick list also removes the
  // mirror entry at the head of this resource's job list.
  while (dev->jobs != nullptr) {
    RndJobList* head = dev->jobs;
    if (head->job != nullptr && head->mirror != nullptr)
      RndDevList_del(head->job, dev);
    else
      RndJobList_del(dev, head->job);
    if (dev->jobs == head) break;
  }

  clear_listitem_backlink(dev->listitem, dev);
  dev->index = -1;
  MA_delete(dev, __LINE__, kUnit);
  return neighbour;
}

int Dev_get_lockstate(const char* word) {
  if (word == nullptr || *word == '\0') return LOCK_UNSET;
  if (strcmp(word, "LOCKED") == 0) return LOCK_LOCKED;
  if (strcmp(word, "AVAILABLE") == 0) return LOCK_AVAILABLE;
  if (strcmp(word, "SCHEDULE") == 0) return LOCK_SCHEDULE;
  return LOCK_UNSET;
}

void Dev_field_check() {
  for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
    // A holder that is no longer a registered editor has died; its lock goes.
    if (dev->lock_pid != 0 && dev->lock_pid != rndctl.pid)
      dev->lock_pid = Editor_process_validate(dev->lock_pid);
  }
}

void reset_autoadd_dev() {
  // setcurrent_dev may reach editor code that changes the list, so every
  // round starts again from the head.
  bool again = true;
  while (again) {
    again = false;
    for (Dev* dev = rndctl.devs; dev != nullptr; dev = dev->next) {
      if (dev->default_dev != 0) {
        dev->default_dev = 0;
        setcurrent_dev(dev);
        again = true;
        break;
      }
    }
  }
}

void setcurrent_dev(Dev* dev) {
  static bool entered = false;
  if (entered) return;
  entered = true;
  Dev* previous = rndctl.current_dev;
  if (previous != nullptr && previous != dev && previous->lock_pid == rndctl.pid)
    previous->lock_pid = 0;
  rndctl.current_dev = dev;
  if (dev != nullptr) dev->lock_pid = rndctl.pid;
  entered = false;
}

bool rj_dev_on_host(const Dev* dev, const char* host) {
  return dev != nullptr && host != nullptr && dev->host_name.is(host);
}

bool rj_dev_is_this_host(const Dev* dev) { return rj_dev_on_host(dev, rndctl.host.c_str()); }

void Job_wake_other_hosts(const Job* job, const std::vector<const Dev*>* full) {
  if (job == nullptr) return;
  std::vector<const char*> woken;  // several resources may stand for one host
  for (const RndDevList* e = job->resources; e != nullptr; e = e->next) {
    const Dev* dev = e->dev;
    if (dev == nullptr || dev->host_name.none() || rj_dev_is_this_host(dev)) continue;
    if (full != nullptr && std::find(full->begin(), full->end(), dev) != full->end()) continue;
    const char* host = dev->host_name.c_str();
    if (std::any_of(woken.begin(), woken.end(),
                    [host](const char* w) { return strcmp(w, host) == 0; }))
      continue;
    woken.push_back(host);
    daemon_updatetime_set(host);
  }
}
