// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

int init_fileop() { return {}; }
int lock_fileop(int /*index*/, int /*take*/) { return {}; }
FILE* read_fileop(int /*index*/) { return {}; }
FILE* update_fileop(int /*index*/) { return {}; }
void rewind_fileop(int /*index*/) {}
void close_fileop(int /*index*/) {}
void close_and_truncate_fileop(int /*index*/) {}
mode_t get_original_umask() { return {}; }
const char* fileop_path(int /*index*/) { return {}; }
const char* const control_names[FILE_COUNT] = {"Render_Job_Control", "Render_Resource_Control", "Render_Tasks", "RndCtl_EditPids", "Render_Dev_next_index", "Render_Job_next_index", "Render_Access", "Render_Status"};
FILE* fileop_access_stream() { return {}; }
void fileop_reset() {}
