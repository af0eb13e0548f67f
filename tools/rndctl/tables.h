/// What the tool prints: the job and host tables for a terminal (80
/// columns, colour only on a terminal and never with NO_COLOR) and the same
/// data as JSON.  Built from the control block's lists and the task groups
/// read; prints nothing of its own beyond what it is given.
#pragma once

#include <cstdio>
#include <nlohmann/json.hpp>
#include <string>

#include "tools/rndctl/editor_side.h"

/// Whether output to `fp` may use colour.
bool Out_colour(FILE* fp);

/// One job's progress: frames done and in total, and a 0..1 fraction
/// (from its state text when it is a percentage).
double Out_job_fraction(const Job* job);

nlohmann::json Out_job_json(const Job* job, const CtlTasks* tasks);
nlohmann::json Out_jobs_json(const CtlTasks* tasks);
nlohmann::json Out_hosts_json(const CtlTasks& tasks);

void Out_jobs_table(FILE* fp, bool colour);
void Out_hosts_table(FILE* fp, const CtlTasks& tasks, bool colour);
void Out_job_full(FILE* fp, const Job* job, const CtlTasks& tasks);

/// A bar of `width` cells for a 0..1 fraction: "[#####.....]".
std::string Out_bar(double fraction, int width);
/// `text` cut to `width` columns, "~" marking a cut.
std::string Out_fit(const std::string& text, size_t width);
