/* A C99 program built against the installed library: every C function is called. */
#include <fileindex/fileindex_c.h>
#include <stdio.h>
#include <string.h>

int main(void) {
  char buffer[64];
  int failures = 0;
  /* Argument checks come first, whatever the system holds. */
  if (FILEIDXQueuePathGet(NULL, buffer, (int)sizeof(buffer)) != -1) ++failures;
  if (FILEIDXQueuePathGet("share", NULL, 10) != -1) ++failures;
  if (FILEIDXDBPathGet("share", buffer, 0) != -1) ++failures;
  /* An unknown share has no locations. */
  if (FILEIDXDBPathGet("no-such-share", buffer, (int)sizeof(buffer)) != -1) ++failures;
  /* Nothing is indexed in an empty system root. */
  if (FILEIDXIsPathIndexed("/share/a") != 0) ++failures;
  if (FILEIDXIsFullPathIndexed("/volume1/share/a") != 0) ++failures;
  if (FILEIDXIsShareIndexed("share") != 0) ++failures;
  printf("%d passed, %d failed\n", 7 - failures, failures);
  return failures == 0 ? 0 : 1;
}
