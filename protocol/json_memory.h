/*
 * Where cJSON's memory comes from. A command's tree is a dozen small pieces that come and go together, on one thread;
 * they are cut from an area that each thread has and that is whole again once the last of them was given back. What
 * does not fit comes from the heap.
 */
#ifndef PROTOCOL_JSON_MEMORY_H
#define PROTOCOL_JSON_MEMORY_H

/* Makes cJSON take its memory so. Called once, before the first tree is made. From then on a tree, and a text that
 * cJSON prints, is given back by the thread that made it. */
void json_memory_install();

#endif
