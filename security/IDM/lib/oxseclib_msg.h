// Message numbers of the security message set oxseclib_msg that libox_idm
// reports, and the table of default texts (oxseclib_msg.cpp).  The numbers
// are indices into cu_mesgtbl_oxseclib_msg and are part of the ABI: never
// renumber.
#ifndef OXSECLIB_MSG_H
#define OXSECLIB_MSG_H

#define OXSECLIB_MSG_COUNT 624

#ifdef __cplusplus
extern "C" {
#endif
extern const char *const cu_mesgtbl_oxseclib_msg[OXSECLIB_MSG_COUNT];
extern const char cu_badid_oxseclib_msg[];
#ifdef __cplusplus
}

namespace idm {

// Named by their message id: kMsg650 is "2650-650".
enum Msg : int {
    kMsg650 = 271,  // incorrect parameters (exported function)           4
    kMsg651 = 272,  // incorrect parameters (internal subroutine)         23 / 4
    kMsg653 = 274,  // identity mapping file not accessible               36
    kMsg654 = 275,  // memory allocation failure                          6 / 36
    kMsg655 = 276,  // internal failure (function, rc, caller)            23
    kMsg656 = 277,  // map file lock not obtained in time                 30
    kMsg657 = 278,  // stream cannot be opened                            23
    kMsg658 = 279,  // memory allocation failure (internal)               23 / 6
    kMsg660 = 281,  // no translator registered for the mnemonic          22
    kMsg661 = 282,  // mutex cannot be initialised                        23
    kMsg662 = 283,  // rule invalid or ambiguous                          38
    kMsg663 = 284,  // rule and id registry types differ                  38
    kMsg664 = 285,  // rule and id token counts differ                    38
    kMsg665 = 286,  // id invalid                                         38
    kMsg666 = 287,  // token mismatch                                     38
    kMsg667 = 288,  // registry mismatch                                  38
    kMsg690 = 315,  // invalid node information entry                     21
    kMsg691 = 316,  // tree insertion failed                              23
    kMsg692 = 317,  // stat() of node information file failed             21
    kMsg693 = 318,  // node information file not readable                 21
    kMsg694 = 319,  // read() of node information file failed             21
    kMsg698 = 323,  // user unknown                                       15
    kMsg699 = 324,  // group of gid unreadable                            15
    kMsg700 = 325,  // getgrent_r failed                                  15
};

}  // namespace idm
#endif

#endif
