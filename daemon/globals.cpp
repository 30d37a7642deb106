#include "daemon/globals.h"

volatile sig_atomic_t g_running = 1;
int g_localSelected = 1;
int g_selectedRenderer = -1;
int g_changed = 0;
