#ifndef VELK_EXPORT_H_
#define VELK_EXPORT_H_

#if defined(VELK_BUILDING_LIBRARY)
#define VELK_EXPORT __attribute__((visibility("default")))
#else
#define VELK_EXPORT
#endif

#endif  // VELK_EXPORT_H_
