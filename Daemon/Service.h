// The life of the daemon's process: listener, run loop, end.
#pragma once

// Runs the daemon on the current platform until it is told to end (SIGTERM, SIGINT). Returns the
// exit status of the process. On the main thread, before any other is started.
int TSYRunDaemon();
