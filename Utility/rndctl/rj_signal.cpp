// Stub bodies: replaced by the real implementation.
#include "Utility/rndctl/rndctl.h"

void sig_handler(int /*sig*/) {}
int RJ_signal(const char* /*host*/, int /*pid*/, int /*sig*/) { return {}; }
const char* RGget_sig_desc(int /*sig*/) { return {}; }
int RJ_sighold(int /*sig*/) { return {}; }
int RJ_sigrelse(int /*sig*/) { return {}; }
int RJ_sigignore(int /*sig*/) { return {}; }
int RJ_sigset(int /*sig*/, void(*)(int)) { return {}; }
unsigned RJ_alarm(unsigned /*seconds*/) { return {}; }
int RJ_pause() { return {}; }
int RJ_wait(int* /*status*/) { return {}; }
volatile int last_signal = 0;
