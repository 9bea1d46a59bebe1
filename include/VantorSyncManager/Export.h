// Symbol visibility of the library's exported names.
#pragma once

#define VSM_EXPORT __attribute__((visibility("default")))
