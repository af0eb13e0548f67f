/// The editor registry (rj_editreg): which queue editors run, so that a
/// record held by an editor that died can be freed again.
///
/// The file is the shared file FILE_EDITPIDS ("RndCtl_EditPids"), one
/// "%s %d %s\n" line (host, pid, user) per editor; reading stops at the
/// first line that does not scan.  In memory a table of 15 slots.  Every
/// read and rewrite is done under the file's lock.
///
/// Calling order: an editor registers with Editor_registry_update(1, ...)
/// at its start; anyone may drop dead editors with
/// Editor_registry_update(0, &dead) and then release their records
/// (Editor_process_list, records/); Editor_process_validate and
/// Editor_process_getuser answer from the table at any time.
///
/// Reads rndctl.location (paths), rndctl.host, rndctl.user and rndctl.pid;
/// writes no field of rndctl.  Nothing here is safe inside a signal handler.
#pragma once

#include <vector>

/// Reads the registry under its lock and writes it back: with `mode` 1 this
/// process is added (refused with a message when the table is full); with
/// `mode` 0 every other editor whose process is gone (RJ_signal) is dropped
/// and its pid appended to `dead` (when not null); any other mode only
/// rewrites.  An unopenable registry is reported ("ERROR: failed to open
/// %s") and left alone; a failed rewrite is reported and the old file stands.
void Editor_registry_update(int mode, std::vector<int>* dead);
/// `pid` when it is a registered editor, else 0.  Reloads the table first
/// when the file changed since the last load (0 when it cannot be opened).
int Editor_process_validate(int pid);
/// The user of the slot holding `pid` (slots past the end of the table
/// included: they keep an earlier load's entries), or null.  Points into
/// the table: valid until the next load.
const char* Editor_process_getuser(int pid);
