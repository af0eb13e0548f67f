// Preferences: where the preferences file is, what a variable's value is, and
// the small profile table the values are read into.
#include "General/pst/pst.h"

#include <pwd.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "Shared/memory/MA_rtns.h"

namespace {

constexpr const char* kUnit = "General/pst/pst";
constexpr const char* kPrefsName = ".ZarnoPrefs";
constexpr const char* kBrowserName = "/.ZarnoBrowserPrefs";
constexpr const char* kInstallDir = "/usr/qm/zarno";
constexpr size_t kPathSize = 1024;
// Expansion works in a buffer of this size: expanded values longer than
// kWorkSize - 1 characters are cut there.
constexpr size_t kWorkSize = 256;

struct FileCloser {
  void operator()(FILE* fp) const { fclose(fp); }
};
using ScopedFILE = std::unique_ptr<FILE, FileCloser>;

// --- process-wide state, never freed --------------------------------------
const char* cached_path = nullptr;  // points at site_path or user_path; non-owning
char site_path[kPathSize];
char user_path[kPathSize];
char default_path[kPathSize];
bool default_made = false;
char _pst_path[kPathSize];
TpstTable* _pst_table = nullptr;
char value_buffer[kWorkSize];
char browser_value[1024];

bool file_exists(const char* path) {
  struct stat st;
  return path[0] != '\0' && stat(path, &st) == 0;
}

// The site file: under ZARNO_LOCATION, else under the install directory when
// it exists, else under the home of the distribution account.  Empty when
// none of them is known; `report` (may be null) is then told.
void make_site_path(char* out, size_t size, void (*report)(const char*, ...)) {
  out[0] = '\0';
  if (const char* location = getenv("ZARNO_LOCATION")) {
    snprintf(out, size, "%s/%s", location, kPrefsName);
    return;
  }
  struct stat st;
  if (stat(kInstallDir, &st) == 0) {
    snprintf(out, size, "%s/%s", kInstallDir, kPrefsName);
    return;
  }
  if (struct passwd* pw = getpwnam("dist")) {
    snprintf(out, size, "%s/%s", pw->pw_dir, kPrefsName);
    return;
  }
  if (report != nullptr) report("Couldn't find ZARNO distribution directory!\n");
}

bool is_name_char(char c) { return isalnum(static_cast<unsigned char>(c)) || c == '_'; }

// Appends `text` to the work buffer, cutting at its end.
void append(char* work, size_t& used, const char* text, size_t length) {
  size_t room = kWorkSize - 1 - used;
  if (length > room) length = room;
  memcpy(work + used, text, length);
  used += length;
  work[used] = '\0';
}

// Expands "~", "$NAME" and "${NAME}" from the environment, in place.  `text`
// holds at most kWorkSize bytes.
void expand(char* text) {
  char work[kWorkSize];
  size_t used = 0;
  work[0] = '\0';
  const char* p = text;
  while (*p != '\0' && used < kWorkSize - 1) {
    if (*p == '~') {
      const char* home = getenv("HOME");
      if (home == nullptr) {
        append(work, used, p, 1);  // nothing to put there: the "~" stays
      } else {
        append(work, used, home, strlen(home));
      }
      p++;
      continue;
    }
    if (*p != '$') {
      append(work, used, p, 1);
      p++;
      continue;
    }
    p++;
    bool braced = *p == '{';
    if (braced) p++;
    char name[kWorkSize];
    size_t n = 0;
    while (is_name_char(*p)) {
      if (n < sizeof name - 1) name[n++] = *p;
      p++;
    }
    name[n] = '\0';
    // A braced name swallows its closing brace, and a blank that ends it.
    if (braced && (*p == '}' || *p == ' ')) p++;
    const char* value = n > 0 ? getenv(name) : nullptr;
    if (value != nullptr) append(work, used, value, strlen(value));
  }
  memcpy(text, work, used + 1);
}

bool blank_only(const char* text) {
  for (; *text != '\0'; text++) {
    if (*text != ' ' && *text != '\t') return false;
  }
  return true;
}

// The value of `name` in the preferences file `path`, expanded; null when the
// file cannot be read, the name is unknown or the value comes out blank.
const char* read_value(const char* path, const char* name) {
  if (path == nullptr || name == nullptr) return nullptr;
  if (_pst_table == nullptr || strcmp(path, _pst_path) != 0) {
    Tpst_delete(_pst_table);
    const char* location = getenv("ZARNO_LOCATION");
    Tpst_set_automerge(location != nullptr ? location : kInstallDir);
    _pst_table = Tpst_read(path);
    if (_pst_table == nullptr) {
      char message[kPathSize + 64];
      snprintf(message, sizeof message, "Unable to read Zarno Preferences file (%s).\n", path);
      perr("%s", message);
      return nullptr;
    }
    snprintf(_pst_path, sizeof _pst_path, "%s", path);
  }
  const char* value = Tpst_get_value(_pst_table, name, 0);
  if (value == nullptr) return nullptr;
  snprintf(value_buffer, sizeof value_buffer, "%s", value);
  expand(value_buffer);
  if (blank_only(value_buffer)) return nullptr;
  return value_buffer;
}

// The value of `key` in the browser preferences file: the word in double
// quotes after it on the last line that starts with it.
const char* browser_lookup(const char* key) {
  const char* home = getenv("HOME");
  if (home == nullptr) return nullptr;
  char path[kPathSize];
  snprintf(path, sizeof path, "%s%s", home, kBrowserName);
  ScopedFILE fp(fopen(path, "re"));
  if (!fp) return nullptr;

  browser_value[0] = '\0';
  size_t key_length = strlen(key);
  bool matched = false;
  bool at_line_start = true;
  char line[1024];
  while (fgets(line, sizeof line, fp.get()) != nullptr) {
    bool starts_line = at_line_start;
    at_line_start = strchr(line, '\n') != nullptr;
    // The rest of an over-long line is not a line of its own.
    if (!starts_line || strncmp(line, key, key_length) != 0) continue;
    // A matching line that does not parse leaves the value of an earlier one.
    if (sscanf(line + key_length, " \"%1023s\"", browser_value) != 1) continue;
    if (char* quote = strchr(browser_value, '"')) *quote = '\0';
    matched = true;
  }
  return matched ? browser_value : nullptr;
}

}  // namespace

void perr(const char* format, ...) {
  va_list ap;
  va_start(ap, format);
  vfprintf(stderr, format, ap);
  va_end(ap);
  fflush(stderr);
}

const char* find_variable_file(int create, int (*copy)(const char*, const char*, int),
                               void (*report)(const char*, ...)) {
  if (cached_path != nullptr) return cached_path;

  // A site file this process may write is the one to use, even over the
  // user's own; otherwise the user's own, when there is one.
  make_site_path(site_path, sizeof site_path, nullptr);
  bool site_usable = file_exists(site_path) && access(site_path, W_OK) == 0;
  if (site_usable) cached_path = site_path;

  if (cached_path == nullptr) {
    if (const char* home = getenv("HOME")) {
      snprintf(user_path, sizeof user_path, "%s/%s", home, kPrefsName);
      cached_path = user_path;
    }
  }
  if (cached_path != nullptr && (site_usable || file_exists(user_path))) return cached_path;

  // No user file: the site file, even read-only.
  make_site_path(site_path, sizeof site_path, report);
  cached_path = site_path;

  if (create != 0 && file_exists(site_path) && copy != nullptr) {
    if (user_path[0] == '\0') {
      if (report != nullptr) report("Could not find HOME directory");
    } else {
      copy(site_path, user_path, 2);
      chmod(user_path, 0644);
      cached_path = user_path;
    }
  }
  return cached_path;
}

const char* find_default_variable_file() {
  if (!default_made) {
    make_site_path(default_path, sizeof default_path, nullptr);
    default_made = true;
  }
  return default_path;
}

const char* get_zarno_variable(const char* name) {
  if (name == nullptr) return nullptr;
  // The current project is the browser's, not a preference.
  if (strcasecmp(name, "ZARNO_DEFAULT_PROJECT") == 0) {
    const char* project = browser_lookup("CURRENT_PROJECT");
    return project != nullptr && project[0] != '\0' ? project : "demo";
  }
  return read_value(find_variable_file(0, nullptr, perr), name);
}

void pst_reset_cache() {
  cached_path = nullptr;
  site_path[0] = '\0';
  user_path[0] = '\0';
  default_path[0] = '\0';
  default_made = false;
  Tpst_delete(_pst_table);
  _pst_table = nullptr;
  _pst_path[0] = '\0';
}

// --- the profile table ------------------------------------------------------

struct TpstEntry {
  TpstEntry* next;  // owned
  char* name;       // owned (MA_strdup)
  char* value;      // owned (MA_strdup)
};

struct TpstTable {
  TpstEntry* entries = nullptr;  // newest first: the first match is the last definition
};

namespace {

char automerge_dir[kPathSize];

// Parses one line: NAME "value".  Returns false for comments, blank and
// malformed lines; on success name and value point into `line`, cut in place.
bool parse_line(char* line, char** name, char** value) {
  char* p = line;
  while (*p == ' ' || *p == '\t') p++;
  if (*p == '#' || !is_name_char(*p)) return false;
  *name = p;
  while (is_name_char(*p)) p++;
  if (*p != ' ' && *p != '\t' && *p != '"') return false;
  char* name_end = p;
  while (*p == ' ' || *p == '\t') p++;
  if (*p != '"') return false;
  char* first = p + 1;
  char* last = strrchr(first, '"');
  if (last == nullptr) return false;
  *name_end = '\0';
  *last = '\0';
  *value = first;
  return true;
}

}  // namespace

TpstTable* Tpst_read(const char* path) {
  if (path == nullptr) return nullptr;
  ScopedFILE fp(fopen(path, "re"));
  if (!fp) return nullptr;
  TpstTable* table = MA_new<TpstTable>(__LINE__, kUnit);
  if (table == nullptr) return nullptr;

  char line[4096];
  bool at_line_start = true;
  while (fgets(line, sizeof line, fp.get()) != nullptr) {
    char* newline = strchr(line, '\n');
    bool starts_line = at_line_start;
    at_line_start = newline != nullptr;
    // An over-long line is skipped whole rather than read as several lines.
    if (!starts_line || (newline == nullptr && !feof(fp.get()))) continue;
    if (newline != nullptr) *newline = '\0';
    char* name = nullptr;
    char* value = nullptr;
    if (!parse_line(line, &name, &value)) continue;
    TpstEntry* entry = static_cast<TpstEntry*>(MA_malloc(sizeof(TpstEntry), __LINE__, kUnit, 1));
    if (entry == nullptr) break;
    entry->name = MA_strdup(name, __LINE__, kUnit);
    entry->value = MA_strdup(value, __LINE__, kUnit);
    entry->next = table->entries;
    table->entries = entry;
  }
  return table;
}

const char* Tpst_get_value(TpstTable* table, const char* name, int /*flags*/) {
  if (table == nullptr || name == nullptr) return nullptr;
  for (TpstEntry* e = table->entries; e != nullptr; e = e->next) {
    if (e->name != nullptr && strcmp(e->name, name) == 0) return e->value;
  }
  return nullptr;
}

void Tpst_delete(TpstTable* table) {
  if (table == nullptr) return;
  TpstEntry* e = table->entries;
  while (e != nullptr) {
    TpstEntry* next = e->next;
    MA_free(e->name, __LINE__, kUnit);
    MA_free(e->value, __LINE__, kUnit);
    MA_free(e, __LINE__, kUnit);
    e = next;
  }
  table->entries = nullptr;
  MA_delete(table, __LINE__, kUnit);
}

void Tpst_set_automerge(const char* directory) {
  snprintf(automerge_dir, sizeof automerge_dir, "%s", directory != nullptr ? directory : "");
}
