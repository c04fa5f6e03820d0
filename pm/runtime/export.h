#pragma once
// Marks a function that a module or program exports by name: the task
// module's pmTask_Factory, the runner's QFProcessManagementGlobals and the
// loopback runtime's NDIlib_* functions. Everything else of ours stays
// hidden (hidden visibility on ELF; on Windows a DLL or program that marks
// any export exports only what is marked).
#if defined(_WIN32)
#define PM_EXPORT __declspec(dllexport)
#else
#define PM_EXPORT __attribute__((visibility("default")))
#endif
