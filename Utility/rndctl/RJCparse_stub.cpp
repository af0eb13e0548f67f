// Stub bodies: replaced by the lexer (RJClex.l) and grammar (RJCgram.y).
#include "Utility/rndctl/rndctl.h"

FILE* RJCin = nullptr;
FILE* RJCout = nullptr;
const char* RJCreadfile = nullptr;
const char* RJCpath = nullptr;
int RJCcurrent_lineno = 0;
int RJClineno = 0;
void (*RJC_fatal_exit)(int) = nullptr;
int RJCparse() { return 0; }
int RJClex() { return 0; }
int RJCwrap() { return 1; }
void RJCerror(const char* /*message*/) {}
void RJClexerror(const char* /*text*/) {}
int RJC_parse_string(const char* /*text*/, size_t /*length*/, const char* /*file_name*/) { return 0; }
