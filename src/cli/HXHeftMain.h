// The run driver, over whatever platform is current.
#pragma once

// One run of heft with the arguments of its command line (argv[0] is the program's name). The exit status, 0
// or 1.
int HXHeftMain(int argc, char *const argv[]);
