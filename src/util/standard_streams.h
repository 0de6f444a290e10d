// The descriptors 0, 1 and 2 of a program that is started without all of them.
#pragma once

// Opens /dev/null on those that are closed. To be called before anything else is opened: what took
// one of these numbers would get the messages that are printed.
void fill_standard_streams();
