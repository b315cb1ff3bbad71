// The temporary files that have not got their final names, for a program that ends in a hurry.
#pragma once

#include <string>

// Notes a temporary file. More than a few at a time are not noted, nor are paths longer than the system's.
void HXNotePendingFile(const std::string &path);
// Forgets it once it has been renamed or removed.
void HXForgetPendingFile(const std::string &path);
// Removes all that are noted. Safe in a signal handler and without memory; from any thread, once.
void HXRemovePendingFiles();
