#ifndef TAVOKARST_EXPORT_H_
#define TAVOKARST_EXPORT_H_

#if defined(KARST_BUILDING_LIBRARY)
#define KARST_EXPORT __attribute__((visibility("default")))
#else
#define KARST_EXPORT
#endif

#endif  // TAVOKARST_EXPORT_H_
