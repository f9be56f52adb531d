// Lock discipline as clang's thread-safety attributes.  The "thread-safety"
// build (clang, -Wthread-safety -Werror) checks them; under g++ every macro
// is empty.  A pthread mutex becomes a capability through the typedef
// idm_mutex_t, so the records keep their C layout.
#ifndef OXIDM_ANNOTATIONS_H
#define OXIDM_ANNOTATIONS_H

#include <pthread.h>

#if defined(__clang__)
#define OXIDM_TSA(x) __attribute__((x))
#else
#define OXIDM_TSA(x)
#endif

#define OXIDM_CAPABILITY(name) OXIDM_TSA(capability(name))
#define OXIDM_SCOPED_CAPABILITY OXIDM_TSA(scoped_lockable)
#define OXIDM_GUARDED_BY(m) OXIDM_TSA(guarded_by(m))
#define OXIDM_PT_GUARDED_BY(m) OXIDM_TSA(pt_guarded_by(m))
#define OXIDM_REQUIRES(...) OXIDM_TSA(requires_capability(__VA_ARGS__))
#define OXIDM_REQUIRES_SHARED(...) OXIDM_TSA(requires_shared_capability(__VA_ARGS__))
#define OXIDM_ACQUIRE(...) OXIDM_TSA(acquire_capability(__VA_ARGS__))
#define OXIDM_ACQUIRE_SHARED(...) OXIDM_TSA(acquire_shared_capability(__VA_ARGS__))
#define OXIDM_RELEASE(...) OXIDM_TSA(release_capability(__VA_ARGS__))
#define OXIDM_RELEASE_SHARED(...) OXIDM_TSA(release_shared_capability(__VA_ARGS__))
#define OXIDM_RELEASE_GENERIC(...) OXIDM_TSA(release_generic_capability(__VA_ARGS__))
#define OXIDM_EXCLUDES(...) OXIDM_TSA(locks_excluded(__VA_ARGS__))
#define OXIDM_NO_THREAD_SAFETY_ANALYSIS OXIDM_TSA(no_thread_safety_analysis)

// A pthread mutex that the analysis knows as a lock.
typedef pthread_mutex_t OXIDM_CAPABILITY("mutex") idm_mutex_t;

#endif
