#pragma once

// Reload and write-back (rj_reload).
int RJC_reload(int flag);
int RRC_reload(int flag);
void Job_control_write(const char* dir);
void Resource_control_write(const char* dir);
int RJC_parse();
int get_fvalue(const char* text, float* value);
void Update_from_demon(int editor);
int RJC_in();
void RJC_out();

/// What a reload tells whoever holds pointers into the record lists from
/// outside (the running-task entries), through RJC_records_hook:
/// RJC_RECORDS_DROPPING_DELETED before the writer frees the jobs marked
/// deleted; RJC_RECORDS_REPLACED once fresh lists were parsed, while the old
/// records still exist (Job_by_index and Dev_by_index answer from the fresh
/// lists), so that each pointer can move to the fresh record of its index or
/// become null.  Null: nobody holds such pointers.  The task units set it
/// when they make their first entry.
enum { RJC_RECORDS_DROPPING_DELETED = 1, RJC_RECORDS_REPLACED = 2 };
extern void (*RJC_records_hook)(int event);
