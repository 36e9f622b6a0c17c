/* The self-test's second process; see inspect.c. */
#ifndef QORBU_DEMO_INSPECT_H
#define QORBU_DEMO_INSPECT_H

#ifdef __cplusplus
extern "C" {
#endif

/* Returns the process exit status: 0 after printing the one-line report. */
int inspect_segment(const char *name);

#ifdef __cplusplus
}
#endif

#endif
