/// The editor registry (Render_Editors): which queue editors run, by pid and
/// user, so that a record held by a live editor is not changed under it.
#pragma once

#include <vector>

// Editor registry (rj_editreg).
/// Reads the registry under its lock and writes it back: with `mode` 1 this
/// process is added; with `mode` 0 every other editor whose process is gone
/// is dropped and its pid appended to `dead` (when not null).  The records
/// such an editor held are released by Editor_process_list (records/).
void Editor_registry_update(int mode, std::vector<int>* dead);
int Editor_process_validate(int pid);
const char* Editor_process_getuser(int pid);
