/// The render registry: the render programs this daemon runs, kept in a
/// file of the temporary directory so that a daemon started after a crash
/// can end the renders its predecessor left running (nobody else would).
///
/// Calling order: rj_render_kill_leftovers once at start-up, before the
/// first render; rj_render_started after each spawn; rj_render_ended when a
/// render's exit is judged.  Reads `rndctl.host` (the file's name).
#pragma once

/// The render registry: pid and start time of every render program this
/// daemon runs, in "%s/zarno_render_demon.%s.renders" (rj_tmpdir(), host),
/// rewritten whole through a fresh name and a rename at every change.
/// rj_render_ended is safe in the SIGCHLD handler (no allocation, no stdio).
void rj_render_started(int pid);
void rj_render_ended(int pid);
/// Kills (SIGKILL to the process group) every render of the registry file
/// that still runs with the recorded start time, then starts an empty
/// registry.  A file that is not a regular file of this user, or that others
/// may write, is not believed.  Returns the number of renders killed.
int rj_render_kill_leftovers();
/// The registry's path (a static buffer).
const char* rj_render_registry_path();
/// Empties the registry (the daemon ended or handed over its renders).
void rj_render_forget_all();
