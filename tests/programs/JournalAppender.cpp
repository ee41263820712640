// Appends to the installed-updates journal at argv[1] until it is killed:
// entry N has the title "N", and after each append the number of entries
// written is printed on a line of its own. The kill test of the journal
// kills it at random moments and checks what the file holds.
#include <cstdio>
#include <string>

#include "update-queue/journal/UpdateJournal.h"

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: %s JOURNAL\n", argv[0]);
    return 2;
  }
  larder::UpdateJournal journal(argv[1]);
  std::size_t count = journal.installedUpdatesJournalIgnoringPendingUpdates(false).size();
  for (;;) {
    journal.appendCriticalUpdates({larder::PlistDictionary{
        {"title", std::to_string(count)}, {"installDate", larder::UpdateJournal::systemClock()}}});
    ++count;
    std::printf("%zu\n", count);
    std::fflush(stdout);
  }
}
