// Intentionally empty: lets a folder library exist before it has sources.
