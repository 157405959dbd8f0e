// Puts a file on the hub and gets it back, and names the outcome with the
// library's text class. usage: put_get SOURCE TARGET
#include <dpx/dpx.h>
#include <dpx/text.h>

#include <cstdio>

int main(int argc, char **argv)
{
    if (argc != 3)
        return 2;
    dpx_status put = PutFile("node1", "installed/cxx.bin", argv[1]);
    dpx_status get = GetFile("node1", "installed/cxx.bin", argv[2]);
    DPX::String outcome(put == DPX_OK && get == DPX_OK ? "put and get done" : "failed");
    const DPX::CharStar text = outcome.c_str();
    std::printf("%s\n", static_cast<const char *>(text));
    return put == DPX_OK && get == DPX_OK ? 0 : 1;
}
