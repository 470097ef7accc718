#include <stdio.h>
#include <unistd.h>
#include <TqOVIXUtility.h>

static int progress(int done, int total) { fprintf(stderr, "\r%d/%d", done, total); return 0; }

int main(int argc, char** argv)
{
    if (argc != 3 || TqInitializeOVIX() != 0) return 2;
    int result = TqGetPropertyOVIX(argv[1]);          /* 0: the movie can be processed */
    if (result == 0) {
        TqSetCallBackNotifyProgressOVIX(progress);    /* optional; return non-zero to stop */
        result = TqExecuteOVIX(argv[1], argv[2]);     /* 0: started */
        while (result == 0 && (result = TqIsFinishedOVIX()) == 0) usleep(50000);
        if (result == 1) result = 0;                  /* 1: finished successfully */
    }
    TqCloseOVIX();
    printf("result %d\n", result);
    return result != 0;
}
