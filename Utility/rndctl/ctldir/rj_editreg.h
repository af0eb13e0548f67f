/// The editor registry (Render_Editors): which queue editors run, by pid and
/// user, so that a record held by a live editor is not changed under it.
#pragma once

// Editor registry (rj_editreg).
void Editor_process_list(int mode);
int Editor_process_validate(int pid);
const char* Editor_process_getuser(int pid);
