// Stub bodies: replaced by the real implementation.
#include "General/pst/pst.h"

const char* get_zarno_variable(const char* /*name*/) { return nullptr; }
const char* find_variable_file(int, int (*)(const char*, const char*, int), void (*)(const char*, ...)) { return nullptr; }
const char* find_default_variable_file() { return ""; }
void perr(const char* /*format*/, ...) {}
void pst_reset_cache() {}
TpstTable* Tpst_read(const char* /*path*/) { return nullptr; }
const char* Tpst_get_value(TpstTable*, const char*, int) { return nullptr; }
void Tpst_delete(TpstTable*) {}
void Tpst_set_automerge(const char*) {}
