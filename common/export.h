// Marks the library's public API; everything else is built with hidden visibility.
#ifndef COMMON_EXPORT_H
#define COMMON_EXPORT_H

#define PTZ_EXPORT __attribute__((visibility("default")))

#endif  // COMMON_EXPORT_H
