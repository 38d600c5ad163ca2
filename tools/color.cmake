# Command-line programs: color.
