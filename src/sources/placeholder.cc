// Event sources.
