// Counts the memory of the library where the real platform libraries are used and memory may run out.
#pragma once

// How many blocks that libosutils.so, libvrastr.so or liborxldap.so allocated since the first call are
// not freed. For programs with one thread.
int libraryBlocks();
