/// `rndctl serve`: the farm's status page and its JSON API over HTTP.
///
/// Read-only: it takes each control file's lock only for the read, changes
/// nothing, and answers every request from the snapshot the watcher thread
/// published (state.h).  Requests:
///   GET /                          the page (page.h)
///   GET /api/jobs                  the job list
///   GET /api/hosts                 the host list
///   GET /api/changed?since=N       {"generation":G}; the page polls it
///   GET /api/jobs/N                one job: tasks, log tail, output tails, frames
///   GET /api/jobs/N/thumb          its latest frame (image/png)
///   GET /api/jobs/N/frames/NAME    one of its frames (image/png)
/// Anything else is 404; a path holding ".." is 400; a body over a few
/// kilobytes is 413; a method other than GET or HEAD is 405.
#pragma once

#include <string>

/// Splits "ADDR:PORT" (or ":PORT", or "PORT").  False with `why` when it is
/// not one.
[[nodiscard]] bool Serve_parse_listen(const std::string& text, std::string* addr, int* port,
                                      std::string* why);

/// Serves until SIGINT, SIGTERM or SIGHUP; 0 then, 1 when it cannot listen.
/// The control block must be open (Ctl_open).
int Cmd_serve(const std::string& listen);
