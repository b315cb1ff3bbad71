// Standard output that remembers why something of it was lost, which a stream by itself does not.
#pragma once

// Puts a stream of that kind in place of stdout, with the same buffering. Once, before anything is written.
void HXWatchStandardOutput();

// Writes what is left: 0, or the errno of the first write that failed.
int HXFlushStandardOutput();
