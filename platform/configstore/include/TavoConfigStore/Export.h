#ifndef TAVOCONFIGSTORE_EXPORT_H_
#define TAVOCONFIGSTORE_EXPORT_H_

#if defined(CONFIGSTORE_BUILDING_LIBRARY)
#define CONFIGSTORE_EXPORT __attribute__((visibility("default")))
#else
#define CONFIGSTORE_EXPORT
#endif

#endif  // TAVOCONFIGSTORE_EXPORT_H_
