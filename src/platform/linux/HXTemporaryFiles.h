// Temporary files, which a signal that ends the program removes.
#pragma once

#include "platform/linux/procfs/HXDescriptor.h"

#include <string>

// Makes a file for writing, readable by its owner alone, by a template that ends in "XXXXXX", and stores its
// path there. Not open with errno set, and the path emptied.
HXDescriptor HXCreateTemporaryFile(std::string *path);
// rename(2): false with errno set, the file then stays.
bool HXRenameTemporaryFile(const std::string &temporaryPath, const std::string &path);
// Keeps errno.
void HXRemoveTemporaryFile(const std::string &temporaryPath);

// Removes all of them, for a program that ends in a hurry: safe in a signal handler and without memory.
void HXRemoveTemporaryFiles();

// What a signal does by default: it ends the program, and while there are temporary files removes them
// before. For sigaction(2).
void (*HXDefaultSignalHandler(int signal))(int);
