/* A plain C caller of the library's entry points: proves the names are
 * unmangled and the header compiles as C. Usage: root log-file service-id */
#include <stdio.h>
#include <string.h>

#include <zeparelayd/daemon.h>
#include <zepasdk/sysroot.h>

int main(int argc, char** argv) {
    char buf[8];
    int found;
    if (argc != 4 || ZEPASysRootSet(argv[1]) != 0) return 100;
    memset(buf, 'x', sizeof(buf));
    found = VLIBRelaydGetServerId(argv[3], buf, (unsigned int)sizeof(buf));
    printf("id %d [%s]\n", found, buf);
    printf("start %d\n", VLIBRelaydLogStart(argv[2]));
    printf("stop %d\n", VLIBRelaydLogStop());
    printf("null %d\n", VLIBRelaydLogStart(NULL));
    return 0;
}
