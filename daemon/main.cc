// SPDX-License-Identifier: Apache-2.0
// kestreld: the factory test daemon of the phone's sensors. It takes no arguments and reads no
// configuration; everything it does starts from kestreld_main.
#include "startup.h"

int main() { return kestreld_main(); }
