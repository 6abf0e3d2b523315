// What libwebapi-TARN5.so exports. The library is compiled with hidden
// visibility: a symbol is exported only when a public header declares it,
// inside "#pragma GCC visibility push(default)" (functions, variables) or,
// for a class, with VELA_EXPORT on its definition (a class takes the
// visibility of its first declaration, which may be a forward declaration
// elsewhere). Everything else is bound inside the library when it is
// linked and costs no symbol look-up when a process loads it.
#pragma once

#define VELA_EXPORT __attribute__((visibility("default")))
