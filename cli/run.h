#pragma once

// The whole program: option scan, run sequence, report. Returns the exit status.
int vsMain(int argc, char **argv);
