// Placeholder until the indications land.
