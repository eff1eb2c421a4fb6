// Replaced as the Linux platform grows.
