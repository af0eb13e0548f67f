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
