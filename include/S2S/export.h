// Symbol visibility for libs2s. The library is built with hidden visibility;
// only declarations marked S2S_EXPORT form its binary interface.
#ifndef S2S_EXPORT_H_
#define S2S_EXPORT_H_

#if defined(S2S_BUILDING_LIBRARY)
#define S2S_EXPORT __attribute__((visibility("default")))
#else
#define S2S_EXPORT
#endif

#endif  // S2S_EXPORT_H_
