// How SQLite reaches its files: by the name "/proc/self/fd/N/FILE" in a directory that is open
// already, whatever the length of the directory's path, and without following a link to it.
#pragma once

// The name of the virtual file system to open a database with. Any thread.
const char* TSYSQLiteVFSName();
