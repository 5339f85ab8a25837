// Symbol visibility of the KOVA platform libraries.
//
// The platform libraries are built with hidden visibility: a function, class or
// object is part of the platform's interface only when its declaration carries
// KOVA_API.

#ifndef KOVA_EXPORT_H_
#define KOVA_EXPORT_H_

#define KOVA_API __attribute__((visibility("default")))

#endif  // KOVA_EXPORT_H_
