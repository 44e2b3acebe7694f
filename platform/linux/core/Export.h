// Marks what the platform library exports: the seam, and the few C++ helpers that the daemons share.
#pragma once
#define TAVO_PLATFORM_API __attribute__((visibility("default")))
