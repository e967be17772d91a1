/* The C interface compiles as C99 and links against the library. */
#include <fileindex/fileindex_c.h>
#include <stdio.h>

int main(void) {
  char buffer[4096];
  /* A null share name is refused before anything else is looked at. */
  int rc = FILEIDXQueuePathGet(NULL, buffer, (int)sizeof(buffer));
  if (rc != -1) {
    fprintf(stderr, "FILEIDXQueuePathGet(NULL) gave %d\n", rc);
    return 1;
  }
  rc = FILEIDXDBPathGet(NULL, buffer, (int)sizeof(buffer));
  if (rc != -1) {
    fprintf(stderr, "FILEIDXDBPathGet(NULL) gave %d\n", rc);
    return 1;
  }
  /* Without a folder.conf nothing is indexed. */
  if (FILEIDXIsPathIndexed("/photo") != 0 || FILEIDXIsFullPathIndexed("/volume1/photo") != 0 ||
      FILEIDXIsShareIndexed("photo") != 0) {
    fprintf(stderr, "an empty system reports an indexed path\n");
    return 1;
  }
  printf("1 passed, 0 failed\n");
  return 0;
}
