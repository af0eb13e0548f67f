// The editor registry: which interactive queue editors are running, so that a
// job or resource held by an editor that died can be freed again.
//
// The registry file holds one "host pid user" entry per line.  In memory it
// is a table of kSlots; the slot after the last entry read has pid 0, which
// ends the table.  Slots past the end keep whatever an earlier load left in
// them: Editor_process_getuser still finds users there.
#include "Utility/rndctl/ctldir/rj_editreg.h"

#include <sys/stat.h>

#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctldir/rj_paths.h"
#include "Utility/rndctl/proc/rj_signal.h"

namespace {

constexpr int kSlots = 15;
constexpr int kTextSize = 80;

struct EditSlot {
  char host[kTextSize];
  char user[kTextSize];
  int pid;  // -1: found dead, dropped by the next write
};

EditSlot edit_table[kSlots];
// Modification time (ns) of the registry file as of its last load by
// Editor_process_validate.  Nanoseconds: a registration made within the same
// second as the last load must still be seen.
int64_t registry_load_time = 0;

void end_table(int n) {
  if (n < kSlots) edit_table[n].pid = 0;
}

// True when the word just scanned was cut by its width limit, i.e. the file
// has more of it: such an entry is garbled, not a shorter name.
bool word_was_cut(FILE* fp) {
  int c = getc(fp);
  if (c == EOF) return false;
  ungetc(c, fp);
  return !isspace(c);
}

// Reads one "host pid user" entry; false where the file stops making sense.
bool read_entry(FILE* fp, EditSlot* slot) {
  char host[kTextSize];
  char number[16];
  char user[kTextSize];
  if (fscanf(fp, "%78s", host) != 1 || word_was_cut(fp)) return false;
  // The pid is taken as a bounded run of sign and digits so that an absurd
  // number is refused instead of overflowing.
  if (fscanf(fp, " %15[-+0123456789]", number) != 1) return false;
  errno = 0;
  char* end = nullptr;
  long pid = strtol(number, &end, 10);
  if (end == number || *end != '\0' || errno != 0 || pid <= 0 || pid > INT_MAX) return false;
  if (fscanf(fp, " %79s", user) != 1 || word_was_cut(fp)) return false;
  memcpy(slot->host, host, sizeof host);
  memcpy(slot->user, user, sizeof user);
  slot->pid = static_cast<int>(pid);
  return true;
}

// Fills the table from the stream; returns the number of entries read.
int read_table(FILE* fp) {
  int n = 0;
  while (n < kSlots && read_entry(fp, &edit_table[n])) n++;
  end_table(n);
  return n;
}

// The registry could not be opened: say so (the caller's lock goes with
// its scope).
void give_up_open(const std::string& path) {
  dbgpnt("ERROR: failed to open %s\n", path.c_str());
  EDuprintf("ERROR: failed to open %s", path.c_str());
}

}  // namespace

void Editor_registry_update(int mode, std::vector<int>* dead) {
  const std::string path = rj_control_path(FILE_EDITPIDS);
  end_table(0);

  FileopLock lock(FILE_EDITPIDS);
  FILE* fp = update_fileop(FILE_EDITPIDS);
  if (fp == nullptr) {
    give_up_open(path);
    return;
  }

  int n = read_table(fp);

  if (mode == 1) {
    if (n < kSlots) {
      EditSlot& slot = edit_table[n];
      snprintf(slot.host, sizeof slot.host, "%s", rndctl.host.or_else(""));
      snprintf(slot.user, sizeof slot.user, "%s", rndctl.user.or_else(""));
      slot.pid = rndctl.pid;
      n++;
      end_table(n);
    } else {
      EDuprintf("ERROR: editor registry %s is full (%d editors): %s:%d not registered",
                path.c_str(), kSlots, rndctl.host.or_else(""), rndctl.pid);
    }
  }

  if (mode == 0 && n > 0 && edit_table[0].pid != 0) {
    for (int i = 0; i < n; i++) {
      EditSlot& slot = edit_table[i];
      if (slot.pid == rndctl.pid) continue;
      dbgpnt("%d %s = %d\n ", i, slot.host, slot.pid);
      if (RJ_signal(slot.host, slot.pid, 0) != 0) {
        dbgpnt("\t\t*** dead ***\n");
        if (dead != nullptr) dead->push_back(slot.pid);
        slot.pid = -1;
      } else {
        dbgpnt("\t\t*** ALIVE ***\n");
      }
    }
  }

  rewind_fileop(FILE_EDITPIDS);
  for (int i = 0; i < n; i++) {
    const EditSlot& slot = edit_table[i];
    if (slot.pid > 0) fprintf(fp, "%s %d %s\n", slot.host, slot.pid, slot.user);
  }
  // A failure is reported there; the old file stands.
  (void)close_and_truncate_fileop(FILE_EDITPIDS);
}

int Editor_process_validate(int pid) {
  const std::string path = rj_control_path(FILE_EDITPIDS);
  struct stat st;
  int64_t t = 0;
  if (stat(path.c_str(), &st) == 0) {
    t = static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000LL + st.st_mtim.tv_nsec;
  }

  if (t > registry_load_time) {
    registry_load_time = t;
    end_table(0);
    FileopLock lock(FILE_EDITPIDS);
    FILE* fp = read_fileop(FILE_EDITPIDS);
    if (fp == nullptr) {
      give_up_open(path);
      return 0;
    }
    read_table(fp);
    (void)close_fileop(FILE_EDITPIDS);  // read only: nothing to lose
  }

  int i = 0;
  while (i < kSlots && edit_table[i].pid != 0 && edit_table[i].pid != pid) i++;
  return i < kSlots ? edit_table[i].pid : 0;
}

const char* Editor_process_getuser(int pid) {
  // Pid 0 is the end mark of the table, not an editor.
  if (pid <= 0) return nullptr;
  for (const EditSlot& slot : edit_table) {
    if (slot.pid == pid) return slot.user;
  }
  return nullptr;
}
