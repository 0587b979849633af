#pragma once
// Interface of the vendor eSE library (libese_qv_hal.so). The caller owns
// every record and buffer it passes.
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// Command APDU in fields; the library builds the bytes.
typedef struct phQvEse_7816_cpdu {
  uint8_t cla;
  uint8_t ins;
  uint8_t p1;
  uint8_t p2;
  uint16_t lc;        // number of bytes at pdata
  uint8_t cpdu_type;  // always 0
  uint8_t* pdata;
  uint8_t le_type;  // 1: Le present, 0: absent
  uint32_t le;      // 256 stands for the Le byte 0x00
} phQvEse_7816_cpdu;

// Response APDU: the data bytes at pdata (len of them), the status word apart.
typedef struct phQvEse_7816_rpdu {
  uint8_t sw1;
  uint8_t sw2;
  uint8_t* pdata;  // caller's buffer
  uint16_t len;    // 2 before a SELECT, 0 otherwise; on return the data byte count
} phQvEse_7816_rpdu;

// A whole APDU as bytes. As a response, `len` counts every byte written,
// SW1 SW2 last.
typedef struct phQvEse_data {
  uint32_t len;
  uint8_t* p_data;
} phQvEse_data;

// The eSE type the library reports; the service stores it here before anything else.
extern int32_t g_korva_exist;

int32_t get_korva_exist_flag(void);
int32_t phQvEse_init_open(void);
int32_t phQvEse_close(void);
int32_t phQvEse_7816_Transceive(phQvEse_7816_cpdu* cpdu, phQvEse_7816_rpdu* rpdu);
int32_t phQVNciHal_Transmit_APDU_by_IPC(phQvEse_data* cmd, phQvEse_data* rsp);
int32_t phQVNciHal_Set_KORVA_READY(void);
int32_t phQVNciHal_Set_KORVA_Power(const char* state);
int32_t phQVNciHal_Get_KORVA_Ready_Status(void);

#ifdef __cplusplus
}
#endif
