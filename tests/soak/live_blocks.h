// Counts the memory of this program: its allocation functions replace those of the C library.
#pragma once

// Blocks that this thread has allocated, less those that it has freed.
long blocksOfThread();
// The same for all threads, in blocks and in usable bytes.
long liveBlocks();
long liveBytes();
