// velascgi: the CGI program the web server runs for every web-API call.
// It works in the web-API directory, where the API descriptions and handler
// libraries are named relative to, and hands the call to one WebEntry.
#include "webentry/Serve.h"

int main(int argc, char** argv)
{
    VELA::ServeCgiRequest(argc, argv, nullptr);
    return 0;
}
