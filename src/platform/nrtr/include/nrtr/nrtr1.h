/* RPC stub support: the per-stub-group record of this machine's data
 * representation and the character translation tables.
 *
 * The translation tables follow EBCDIC code page 037 (US/Canada): the
 * ASCII-to-EBCDIC table maps each byte 0..255 (taken as ISO 8859-1) to its
 * CP037 byte, and the EBCDIC-to-ASCII table is its inverse. The two are
 * exact inverses of each other. */
#ifndef NRTR_NRTR1_H
#define NRTR_NRTR1_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define NRTR1_API __attribute__((visibility("default")))

/* ---- Data representation of a body --------------------------------- */

/* drep: bits 31..28 int_rep (0 big-endian, 1 little-endian), 27..24
 * char_rep (0 ASCII, 1 EBCDIC), 23..16 float_rep (0 IEEE). */
#define NCS_DREP(int_rep, char_rep, float_rep) \
    ((((uint32_t)(int_rep)&0xFu) << 28) | (((uint32_t)(char_rep)&0xFu) << 24) | (((uint32_t)(float_rep)&0xFFu) << 16))
#define NCS_DREP_INT(d)   (((d) >> 28) & 0xFu)
#define NCS_DREP_CHAR(d)  (((d) >> 24) & 0xFu)
#define NCS_DREP_FLOAT(d) (((d) >> 16) & 0xFFu)
#define NCS_INT_BIG    0u
#define NCS_INT_LITTLE 1u
#define NCS_CHAR_ASCII  0u
#define NCS_CHAR_EBCDIC 1u
#if __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
#define NCS_DREP_LOCAL NCS_DREP(NCS_INT_LITTLE, NCS_CHAR_ASCII, 0)
#else
#define NCS_DREP_LOCAL NCS_DREP(NCS_INT_BIG, NCS_CHAR_ASCII, 0)
#endif

#define IDLBASE_DATA_SIZE 80u

/* Filled once per stub group by NRTR1_InitData. Pointer fields are 8 bytes
 * wide in a 64-bit build; the record keeps its 80 bytes. */
typedef struct IDLBASE_DATA {
    uint32_t size;                    /* IDLBASE_DATA_SIZE, set statically */
    uint32_t drep;                    /* this machine's data representation */
    const unsigned char *ascii_to_ebcdic;  /* 256 bytes */
    const unsigned char *ebcdic_to_ascii;  /* 256 bytes */
    unsigned char runtime[56];        /* the runtime's; not read by stubs */
} IDLBASE_DATA;

/* Fills `data` (an IDLBASE_DATA): drep and the two tables. */
NRTR1_API void NRTR1_InitData(void *data);

/* The two tables, for writers of foreign bodies (tests, tools). */
NRTR1_API const unsigned char *NRTR1_AsciiToEbcdic(void);
NRTR1_API const unsigned char *NRTR1_EbcdicToAscii(void);

#ifdef __cplusplus
}
static_assert(sizeof(IDLBASE_DATA) == IDLBASE_DATA_SIZE, "IDLBASE_DATA_ is 80 bytes");
#endif
#endif
