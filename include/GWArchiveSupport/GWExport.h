#pragma once

// What the shared library exports: the classes, functions and constants of
// these headers. Everything else it holds is built hidden.
#define GW_EXPORT __attribute__((visibility("default")))
