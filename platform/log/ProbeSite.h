// ProbeSite (internal to platform/log, included by Probes.cpp only): the
// macro that plants one USDT probe site of provider "tenond".
//
// <sys/sdt.h> names a probe's semaphore by pasting provider##_##name##_semaphore
// and its note's name by stringizing the same token, so a probe named with a
// hyphen ("client-new", the name tracers know) cannot have a semaphore. This
// macro follows the structure of the header's _SDT_PROBE/_SDT_ASM_BODY but
// takes the semaphore symbol and the probe name (a string literal) apart, and
// reuses the header's helpers for everything else: the argument encoding
// (_SDT_ARGFMT, _SDT_ASM_OPERANDS_n), the assembler macros that turn it into
// "-4@%edi" specs (_SDT_DEF_MACROS), and the .stapsdt.base anchor
// (_SDT_ASM_BASE).
//
// The note written is the standard stapsdt note (type 3, owner "stapsdt"):
// the probe's address, the .stapsdt.base address, the semaphore's address,
// then provider, name and argument specs as NUL-terminated strings. Tracers
// increment the semaphore (an unsigned short in section ".probes") while
// attached, which is what the is-enabled test reads.

#pragma once

#include <sys/sdt.h>

// The argument encoding of <sys/sdt.h> uses C casts; the warnings are about
// the header's code, not ours.
#if defined(__clang__)
#define TN_SDT_SUPPRESS_BEGIN \
  _Pragma("clang diagnostic push") _Pragma("clang diagnostic ignored \"-Wold-style-cast\"")
#define TN_SDT_SUPPRESS_END _Pragma("clang diagnostic pop")
#else
#define TN_SDT_SUPPRESS_BEGIN \
  _Pragma("GCC diagnostic push") _Pragma("GCC diagnostic ignored \"-Wold-style-cast\"")
#define TN_SDT_SUPPRESS_END _Pragma("GCC diagnostic pop")
#endif

// The note of one probe; `name` is a string literal, `semaphore` a symbol
// with C linkage. Same lines as _SDT_ASM_BODY's, whose spacing matters: the
// tokens are stringized into assembler text.
#define TN_SDT_ASM_BODY(provider, name, semaphore, pack_args, args)            \
  _SDT_DEF_MACROS                                                              \
  _SDT_ASM_1(990:    _SDT_NOP)                                                 \
  _SDT_ASM_3(        .pushsection .note.stapsdt,_SDT_ASM_AUTOGROUP,"note")     \
  _SDT_ASM_1(        .balign 4)                                                \
  _SDT_ASM_3(        .4byte 992f-991f, 994f-993f, _SDT_NOTE_TYPE)              \
  _SDT_ASM_1(991:    .asciz _SDT_NOTE_NAME)                                    \
  _SDT_ASM_1(992:    .balign 4)                                                \
  _SDT_ASM_1(993:    _SDT_ASM_ADDR 990b)                                       \
  _SDT_ASM_1(        _SDT_ASM_ADDR _.stapsdt.base)                             \
  _SDT_ASM_1(        _SDT_ASM_ADDR semaphore)                                  \
  _SDT_ASM_STRING(provider)                                                    \
  _SDT_ASM_1(        .asciz name)                                              \
  pack_args args                                                               \
  _SDT_ASM_SUBSTR(\x00)                                                        \
  _SDT_UNDEF_MACROS                                                            \
  _SDT_ASM_1(994:    .balign 4)                                                \
  _SDT_ASM_1(        .popsection)

// Plants a probe site of provider tenond with `n` arguments given as a
// parenthesised list, e.g. TN_SDT_PROBE(tenond_db_load_semaphore, "db-load",
// 2, (domain, code)). Each argument is evaluated once.
#define TN_SDT_PROBE(semaphore, name, n, arglist)                                 \
  do {                                                                            \
    TN_SDT_SUPPRESS_BEGIN                                                         \
    __asm__ __volatile__("" ::"m"(semaphore));                                    \
    __asm__ __volatile__(TN_SDT_ASM_BODY(tenond, name, semaphore, _SDT_ASM_ARGS, (n)) \
                         ::_SDT_ASM_OPERANDS_##n arglist);                        \
    __asm__ __volatile__(_SDT_ASM_BASE);                                          \
    TN_SDT_SUPPRESS_END                                                           \
  } while (0)
