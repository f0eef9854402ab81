// Initialisation of the daemon: its log, its queues, what a start of it does.
#pragma once

// Runs once, before any request is served, on the listener queue. What cannot be done without ends
// the process; everything else is logged and passed over.
void TSYInitialiseDaemon();
