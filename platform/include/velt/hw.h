/*
 * The NAS's own hardware: its buzzer. May be called from several threads;
 * failures set the platform's last error (vlibc.h).
 */
#ifndef VELT_HW_H
#define VELT_HW_H

#include "velt/vlibc.h"

#ifdef __cplusplus
extern "C" {
#endif

#define VELT_BEEP_SHORT 1
#define VELT_BEEP_LONG 2

/* Sounds the buzzer once, a short or a long beep (VELT_BEEP_...). Returns
 * 0; negative with VLIBC_ERR_BAD_PARAMETER for another kind and
 * VLIBC_ERR_IO when the buzzer cannot be reached. */
VELT_API int VELTBuzzerBeep(int kind);

#ifdef __cplusplus
}
#endif

#endif
