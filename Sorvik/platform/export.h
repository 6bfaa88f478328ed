#pragma once

// Marks the plug-in's entry points as the library's only exports.
#if defined(_WIN32)
#define SORVIK_EXPORT __declspec(dllexport)
#else
#define SORVIK_EXPORT __attribute__((visibility("default")))
#endif
