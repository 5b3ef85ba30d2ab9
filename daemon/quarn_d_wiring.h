/**
 * @file quarn_d_wiring.h
 * @brief Where lower floors are told whom they tell and ask on the floors above.
 */
#ifndef QUARN_D_WIRING_H
#define QUARN_D_WIRING_H

/** Set every hook between floors. Main thread, once at start, before any of the floors works. */
void wire_floors();

#endif
