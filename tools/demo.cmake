# Command-line programs: demo.
