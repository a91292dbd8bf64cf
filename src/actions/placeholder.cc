// Handlers of the rules' actions.
