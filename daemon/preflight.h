// Checks made before the daemon detaches, so that a start that cannot work
// is reported on standard error with a non-zero status instead of only in
// the log of a process that has already left its terminal.
#ifndef TARN_PREFLIGHT_H
#define TARN_PREFLIGHT_H

#include <string>
#include <vector>

// Checks, for the paths and keys of this run (TARN_ROOT, TARN_SHM_KEY):
// the pid file's folder is writable and the pid file is a file; each socket
// path fits a socket address, its folder is writable, and nothing but a
// socket stands there, and no process answers on the control socket; each
// status segment that exists can be attached with the size the daemon uses.
// When another daemon runs according to the pid file nothing is checked (the
// start-up reports that case itself). Returns 0 when everything holds, else
// -1 with one line per problem in *problems. Changes nothing.
int DaemonPreflight(std::vector<std::string> *problems);

// Problems that do not stop the start (mplayer-daemon missing: renderers
// still play), one line each.
void DaemonPreflightWarnings(std::vector<std::string> *warnings);

#endif
