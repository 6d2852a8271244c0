// Visibility of the public interface: the library is built with hidden symbols, and everything a
// program may use carries S2S_EXPORT.
#ifndef S2S_EXPORT_H
#define S2S_EXPORT_H

#define S2S_EXPORT __attribute__((visibility("default")))

#endif  // S2S_EXPORT_H
