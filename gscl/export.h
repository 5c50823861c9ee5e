// Marks what libzn_gscl.so exports; everything else in it is hidden.
#ifndef GSCL_EXPORT_H
#define GSCL_EXPORT_H

#define ZN_GSCL_EXPORT __attribute__((visibility("default")))
// For a private member of an exported class.
#define ZN_GSCL_HIDDEN __attribute__((visibility("hidden")))

#endif
