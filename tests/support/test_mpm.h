// Small pieces the test programs share: numbered texts, the count of open
// descriptors, and what the test translators hand over (heap copies the
// library never frees) with the cleanup that frees them.
#ifndef OXIDM_TEST_MPM_H
#define OXIDM_TEST_MPM_H

#include <dirent.h>

#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

#include "oxidm.h"

namespace oxtest {

// A prefix and a number as one text (appended: GCC 12 -O3 misreads
// literal + string).
inline std::string num(const char *prefix, long n) { return std::string(prefix).append(std::to_string(n)); }

// Descriptors open in this process now (not the one listing them).
inline int open_descriptors() {
    int n = -1;
    DIR *d = opendir("/proc/self/fd");
    while (dirent *e = readdir(d)) n += e->d_name[0] != '.';
    closedir(d);
    return n;
}

inline char *heap_copy(const char *s, size_t n) {
    auto *p = static_cast<char *>(std::malloc(n + 1));
    std::memcpy(p, s, n);
    p[n] = '\0';
    return p;
}
inline char *heap_copy(const char *s) { return heap_copy(s, std::strlen(s)); }

inline char **one_token(const char *s) { return new (std::malloc(sizeof(char *))) char *(heap_copy(s)); }

// A mapping buffer holding `local` with its NUL, as translators fill it.
inline idm_buffer *mapping_of(const char *local) {
    return new (std::malloc(sizeof(idm_buffer))) idm_buffer{static_cast<uint32_t>(std::strlen(local) + 1), heap_copy(local)};
}

// What the test translators hand over: a rule (when there is an entry) of
// registry type "t", registry "r" and the one token `token` (the entry's
// network identifier when null), mapping to the entry's local identifier;
// and an id of the same registry with the network identifier as its token.
inline void fill_rule_and_id(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id,
                             const char *token = nullptr) {
    if (entry != nullptr)
        *rule = {0, heap_copy("t"), heap_copy("r"), 1, one_token(token ? token : entry->network_id),
                 entry->local_id ? mapping_of(entry->local_id) : nullptr};
    *id = {heap_copy("t"), heap_copy("r"), 1, one_token(network_id)};
}

// Frees what a test translator put in a rule and an id (one token at most)
// and clears both records.
inline int32_t free_rule_and_id(idm_rule *rule, idm_id *id) {
    auto texts = [](auto *r) {
        std::free(r->rgy_type);
        std::free(r->rgy);
        if (r->tokens != nullptr) std::free(r->tokens[0]);
        std::free(r->tokens);
        *r = {};
    };
    if (rule != nullptr) {
        if (rule->mapping != nullptr) std::free(rule->mapping->value);
        std::free(rule->mapping);
        texts(rule);
    }
    if (id != nullptr) texts(id);
    return 0;
}

}  // namespace oxtest

#endif
