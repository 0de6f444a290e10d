// How much a test asks of the machine that it runs on.
#pragma once

// Whether this is the emulated board, or a build that a sanitizer slows down: less load will do.
bool is_slow_machine();

// How often to repeat what only a rare moment spoils: `many` times, a third of it under a
// sanitizer, or a tenth of it on the board.
int rounds(int many);
