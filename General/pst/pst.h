/// Preferences: finding the preferences file (the site's or the user's own
/// ".ZarnoPrefs"), reading a named variable from it, and expanding "~",
/// "$VAR" and "${VAR}" in the value.
///
/// Returned texts live in static buffers of this unit: valid until the next
/// call, never freed by the caller.  Not reentrant; not for signal handlers.
///
/// The file format read by the profile layer (Tpst_*), one entry per line:
///     # a comment (also after blanks); blank lines are skipped
///     NAME "value text"
/// NAME is a run of letters, digits and '_'; the value is everything between
/// the first and the last double quote of the line.  A later line for the
/// same NAME overrides an earlier one.  Lines longer than 4095 characters and
/// lines without a quoted value are skipped.
///
/// Where the preferences file is: a site file ".ZarnoPrefs" (under
/// ZARNO_LOCATION, else under the install directory, else under the home of
/// the distribution account) when this process may write it; else the user's
/// own "$HOME/.ZarnoPrefs" when it exists; else the site file even read-only.
/// The path is found once per process.
#pragma once

/// Looks a variable up; null when it is not set, or set to blanks only.
const char* get_zarno_variable(const char* name);
/// The preferences file path (cached); see the unit for the rule.
const char* find_variable_file(int create, int (*copy)(const char*, const char*, int),
                               void (*report)(const char*, ...));
/// The site file path (cached separately), or an empty path.
const char* find_default_variable_file();
/// Prints to stderr and flushes.
void perr(const char* format, ...) __attribute__((format(printf, 1, 2)));

/// Forgets every cached path and table (for tests that change HOME and the like).
void pst_reset_cache();

// The profile layer under the lookup.
struct TpstTable;
/// Reads a profile file into a new table; null when it cannot be read.
TpstTable* Tpst_read(const char* path);
/// The text value of a named variable, or null.  Valid while the table lives.
const char* Tpst_get_value(TpstTable* table, const char* name, int flags);
/// Frees a table; null does nothing.
void Tpst_delete(TpstTable* table);
/// Names the directory of the master files that a profile is merged with.  The
/// line format above has no master files: the name is only kept.
void Tpst_set_automerge(const char* directory);
