/* QORBU_API marks the functions and data that libqorbu exports; the library
 * is built with hidden visibility, so nothing else leaves it. Included by
 * each subsystem's chief header. */
#ifndef QORBU_QORBU_API_H
#define QORBU_QORBU_API_H

#ifndef QORBU_API
#define QORBU_API __attribute__((visibility("default")))
#endif

#endif
