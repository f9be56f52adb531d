// Message table of the security message set oxseclib_msg (catalogue
// "oxseclib.cat", set 1): the default text of every message, indexed by its
// number within the set.  Data only.  The entries that libox_idm reports keep
// their numbers and texts exactly; the others belong to other components of
// the security service that share the set, and stand here as one text.
//
// Written in C for its range designators ([a ... b]), a GNU extension that
// gcc and clang both take; hence the one pedantic warning turned off here.
#include "oxseclib_msg.h"

#pragma GCC diagnostic ignored "-Wpedantic"

#define OTHER_COMPONENT "oxseclib_msg: message of another component of the security service.\n"

const char cu_badid_oxseclib_msg[] = "Bad message id for message set oxseclib_msg";

const char *const cu_mesgtbl_oxseclib_msg[OXSECLIB_MSG_COUNT] = {
    [0] = "Reserved: DO NOT USE!",
    [1 ... 270] = OTHER_COMPONENT,
    [271] = "2650-650 libox_idm Failure: Incorrect parameters detected.\n\t Detecting function name: %1$s\n\t Positional parameter in error: %2$d\n\t Value of parameter: 0x%3$x\nVerify that the application is providing the correct parameters to this\nfunction, and correct the application to pass valid parameters.\n",
    [272] = "2650-651 libox_idm Failure: Incorrect parameters detected by an internal\nsubroutine.\n\t Detecting function name: %1$s\n\t Positional parameter in error: %2$d\n\t Value of parameter: 0x%3$x\nContact the system administrator and report this problem.  System\nadministrators should report this failure to the cluster software service\nrepresentative.\n",
    [273] = OTHER_COMPONENT,
    [274] = "2650-653 libox_idm Failure: The specified identity mapping file\ncannot be accessed by this process.  The permissions on the file do not permit\nthe user of this process to access the file.  Verify that the user of this\napplication has sufficient privilege to access the identity mapping files.\n\t Failing routine name: %1$s\n\t Identity mapping file name: %2$s\n",
    [275] = "2650-654 libox_idm Memory allocation failure.\n\t Function name: %1$s\n\t Attempted allocation: %2$d bytes\nMost often, this failure occurs when a process exceeds its memory allocation\nlimit.  In rare cases, this failure occurs when a number of processes\nallocate huge amounts of memory and utilize all available memory on the\nsystem.  Verify that the allocation itself is not exceeding its own limit.\nIf a Cluster software trusted service is exceeding its limit, contact Tervane\nCustomer Support and report this incident.  If another software application\nis exceeding its limit, examine the software for memory management problems\nand memory leaks.  If the application is not exceeding its memory allocation\nlimits, contact the system administrator and report this incident.  System\nadministrators should identify processes using excessive memory and consider\nterminating these processes.\n",
    [276] = "2650-655 libox_idm Internal failure detected.\n\t Function name: %1$s\n\t Return code from function: %2$d\n\t Routine calling the function: %3$s\nContact the cluster security software service representative and report this\nincident.\n",
    [277] = "2650-656 libox_idm Failure: This routine was not able to lock the\nidentity mapping definition file for exclusive use within a reasonable period\nof time.  Another process has exclusive use of the file.  Retry this request\nat a later time.  If the condition persists, examine the system for other\nprocesses that may be attempting to examine or modify the same identity map\nfile.  A process making use of the same file may have become suspended and\nmay need to be forcibly shut down.  If this file is not in use by another\nprocess and the condition persists, consider removing and recreating the\nidentity mapping file or restoring a backup copy of the file.  If you choose\nto remove this file, be aware that the identity mapping and group based\nauthorization functions of the cluster security service may not be able to\nfunction without this file.  While the file is missing or locked, \nauthorization attempts may fail.\n\t Failing routine name: %1$s\n\t Identity mapping definition file name: %2$s\n",
    [278] = "2650-657 libox_idm Failure: Unable to open a stream for an\nidentity mapping definition file.  Report this failure to the system\nadministrator.  System administrators should report this failure to the\ncluster security software service representative.\n\t Identity mapping definition file: %1$s\n\t File descriptor value: %2$s\n\t Error code from fdopen subroutine: %3$d\n",
    [279] = "2650-658 libox_idm Failure: Memory allocation failure:\n\t Function name: %1$s\n\t Attempted allocation: %2$d bytes\nMost often, this failure occurs when a process exceeds its memory allocation\nlimit.  In rare cases, this failure occurs when a number of processes\nallocate huge amounts of memory and utilize all available memory on the\nsystem.  Verify that the allocation itself is not exceeding its own limit.\nIf a Cluster software trusted service is exceeding its limit, contact Tervane\nCustomer Support and report this incident.  If another software application\nis exceeding its limit, examine the software for memory management problems\nand memory leaks.  If the application is not exceeding its memory allocation\nlimits, contact the system administrator and report this incident.  System\nadministrators should identify processes using excessive memory and consider\nterminating these processes.\n",
    [280] = OTHER_COMPONENT,
    [281] = "2650-660 libox_idm Failure: The MPM calling the IDM mapping service\ndid not register a translator and cleanup routine with the IDM's native\nmapping service.\n\t MPM mnemonic: %1$s\n",
    [282] = "2650-661 libox_idm Failure: The library was unable to initialize a\nmutex required by its internal structure.\n\t Routine where error occurred: %1$s\n",
    [283] = "2650-662 libox_idm Failure: The rule structure does not contain\nvalid registry information or a valid number of tokens, or is ambiguous.\n",
    [284] = "2650-663 libox_idm Failure: The rule structure and the id structure\ndo not share the same registry information.\n",
    [285] = "2650-664 libox_idm Failure: The rule structure and the id structure\ncontain a different number of tokens.\n\t Number of tokens contained by the rule structure: %1$d\n\t Number of tokens contained by the id structure: %2$d\n",
    [286] = "2650-665 libox_idm Failure: The rule structure does not contain\nvalid registry information of a valid number of tokens.\n",
    [287] = "2650-666 libox_idm Failure: Unable to find a match between a rule\ntoken (%1$s) and the corresponding id token (%2$s).\n",
    [288] = "2650-667 libox_idm Failure: Unable to find a match between the rule\nregistry (%1$s) and the id registry (%2$s).\n",
    [289 ... 314] = OTHER_COMPONENT,
    [315] = "2650-690 libox_idm Invalid entry in cluster hosts configuration file.\n",
    [316] = "2650-691 libox_idm Error while inserting the balanced tree node.\n",
    [317] = "2650-692 libox_idm: stat() system call on cluster hosts configuration \n\t\tfile failed\n",
    [318] = "2650-693 libox_idm: The process doesn't have permissions to read the \n\t\tcluster hosts configuration file.\n",
    [319] = "2650-694 libox_idm: read() system call failed.\n",
    [320 ... 322] = OTHER_COMPONENT,
    [323] = "2650-698 libox_idm Failure: The user specified by name \"%1$s\" does not exist on this system.\nBefore attempting to acquire group membership, please make sure the user name\nprovided represents a valid user on the system.\n",
    [324] = "2650-699 libox_idm Failure: Unable to get information about the group specified by group id %1$d.\n",
    [325] = "2650-700 libox_idm Failure: getgrent_r() failed with errno = %1$d.\n",
    [326 ... OXSECLIB_MSG_COUNT - 1] = OTHER_COMPONENT,
};
