// NXBASE_EXPORT marks the classes and functions that the shared library
// exports; everything else is hidden (-fvisibility=hidden).
#ifndef NXBASE_EXPORT_H_
#define NXBASE_EXPORT_H_

#define NXBASE_EXPORT __attribute__((visibility("default")))

#endif  // NXBASE_EXPORT_H_
