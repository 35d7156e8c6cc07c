// Symbol visibility for libquvaidx.
//
// The shared library is built with hidden visibility; only declarations
// marked QUVAIDX_API are part of its interface.
#ifndef QUVAIDX_EXPORT_H_
#define QUVAIDX_EXPORT_H_

#if defined(__GNUC__) || defined(__clang__)
#define QUVAIDX_API __attribute__((visibility("default")))
#define QUVAIDX_PRINTF(fmt_index, first_arg) \
  __attribute__((format(printf, fmt_index, first_arg)))
#else
#define QUVAIDX_API
#define QUVAIDX_PRINTF(fmt_index, first_arg)
#endif

#endif  // QUVAIDX_EXPORT_H_
