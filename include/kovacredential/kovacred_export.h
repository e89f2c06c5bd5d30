// Symbol visibility for the public interface of libkovacredential.
#ifndef KOVACREDENTIAL_KOVACRED_EXPORT_H
#define KOVACREDENTIAL_KOVACRED_EXPORT_H

#if defined(__GNUC__)
#define KOVA_EXPORT __attribute__((visibility("default")))
#else
#define KOVA_EXPORT
#endif

#endif  // KOVACREDENTIAL_KOVACRED_EXPORT_H
