// The program, from its arguments to its exit status.
#pragma once

// Carries out the options in their order. The exit status is 0 when the last one succeeded and 1 otherwise.
int xmain(int argc, char** argv);
