# Command-line programs: registry.
