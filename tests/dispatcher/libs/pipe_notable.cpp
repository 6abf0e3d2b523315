// A shared object that is no handler library: it exports no GetAPITable.
#define HANDLER_EXPORT extern "C" __attribute__((visibility("default")))

HANDLER_EXPORT int PipeNoTable(void) { return 0; }
