// What the shared library shows, marked at its declaration.
#ifndef COMMON_EXPORT_H_
#define COMMON_EXPORT_H_

// Marks what the shared library shows to its callers; everything else is hidden.
#define VEXLO_EXPORT __attribute__((visibility("default")))

#endif  // COMMON_EXPORT_H_
