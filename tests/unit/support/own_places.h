/**
 * @file own_places.h
 * @brief /tmp, /opt and /dev/shm that only this process and its children see.
 *
 * The daemon's staging directory, the archives it exports and the companion's package have fixed
 * names in the first two, so two test programs would meet in them; in the last they would share the
 * room, and leave what a killed one had there.
 */
#ifndef OWN_PLACES_H
#define OWN_PLACES_H

/**
 * Put an empty folder in memory over each of the machine's, which goes with the last process that
 * sees it. The build's own folders stay where they were, also when they lie there. Where the system
 * does not let the process (it is not root, say) it waits until it is the only such process, and
 * keeps the machine's. A program that such a process starts sees what that one sees. Before the
 * first thread.
 */
void enter_own_places();

#endif
