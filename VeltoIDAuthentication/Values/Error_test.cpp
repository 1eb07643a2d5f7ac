// Error
