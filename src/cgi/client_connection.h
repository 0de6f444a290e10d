#pragma once

// Prepares a client's connection as it arrives: no program that is started inherits it, and a
// TCP peer that has gone without a word (a cable was cut) is given up after two minutes, whether
// data is under way or not; so is one that reads nothing for as long while there is more for it.
// Other kinds of descriptors are their owner's business.
void prepare_client(int fd);
