"""The parts of bench/soak: clients good and bad, edits by hand, and what is measured."""
