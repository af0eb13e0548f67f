#pragma once

#include "Utility/rndctl/records/rj_records.h"

// Job validation and comparison (rj_jobcheck).
int RJCget_next_index(int file_id);
char* get_strstr(const char* key, char* line);
int Job_check_sdlfields(Job* job);
int Job_set_frame_range(Job* job);
int Calc_frame_range(float start, float end, float step);
int Job_check_sdl(Job* job);
void Job_field_check();
int Job_file_search(const char* host);
int ISA_devdif(Dev* a, Dev* b);
int ISA_jobdif(Job* a, Job* b);

/// Updates the editor registry (Editor_registry_update) and frees every job
/// and resource that an editor found dead had current (its lock_pid).
void Editor_process_list(int mode);
