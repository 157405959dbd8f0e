/* A C program of another project: puts a file on the hub and gets it back
 * through the installed library. usage: put_get SOURCE TARGET */
#include <dpx/dpx.h>

#include <stdio.h>

int main(int argc, char **argv)
{
    if (argc != 3)
        return 2;
    dpx_status put = PutFile("node1", "installed/c.bin", argv[1]);
    dpx_status get = GetFile("node1", "installed/c.bin", argv[2]);
    printf("put 0x%08X get 0x%08X\n", put, get);
    return put == DPX_OK && get == DPX_OK ? 0 : 1;
}
